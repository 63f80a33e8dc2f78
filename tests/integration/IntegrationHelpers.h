#pragma once
// What the integration tests share beyond the daemon itself: a connection that speaks
// raw bytes, a client of the library (libmxreporting, through its C++ header) with the
// tests' reports as its payloads, a small tmpfs to fill, and the memory a daemon may
// take however a client behaves.

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>
#include <utility>

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <msgpack.hpp>

#include <mxreporting/mxreporting.hpp>

#include "integration/DaemonProcess.h"
#include "value/JsonValue.h"
#include "value/Value.h"
#include "wire/MsgpackRpcMessage.h"
#include "wire/MsgpackValue.h"

namespace mx::testing {

// What the daemon may take in all, however a client behaves. Under a sanitizer its
// own shadow memory and quarantine come on top.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
inline constexpr std::size_t kMemoryBound = std::size_t{512} << 20;
#else
inline constexpr std::size_t kMemoryBound = std::size_t{64} << 20;
#endif

// A connection that speaks bytes, for what no well-behaved client would send.
class RawConnection {
public:
    explicit RawConnection(const std::filesystem::path& socketPath)
    {
        fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, socketPath.c_str(), sizeof(address.sun_path) - 1);
        connected_ = ::connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0;
    }
    ~RawConnection() { close(); }
    void close()
    {
        if (fd_ >= 0)
            ::close(std::exchange(fd_, -1));
    }

    bool connected() const { return connected_; }
    bool send(const std::string& bytes)
    {
        return ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL) == ssize_t(bytes.size());
    }

    // True once the daemon has closed its end.
    bool waitForClose()
    {
        return waitUntil([&] {
            char byte;
            ssize_t got = ::recv(fd_, &byte, 1, MSG_DONTWAIT);
            return got == 0 || (got < 0 && errno != EAGAIN && errno != EWOULDBLOCK);
        });
    }

    int fd() const { return fd_; }

private:
    int fd_ = -1;
    bool connected_ = false;
};

// Requests written in one go on a raw connection, and `responses` of their responses
// read back, each in its request's place: what a pipelining client sees.
using RawRequest = std::pair<std::string, Array>;
inline std::vector<RpcResponse> exchange(RawConnection& connection, const std::vector<RawRequest>& requests,
                                         std::size_t responses)
{
    msgpack::sbuffer bytes;
    for (std::size_t i = 0; i < requests.size(); ++i)
        encodeRpcRequest(bytes, static_cast<std::uint32_t>(i), requests[i].first, requests[i].second);
    EXPECT_TRUE(connection.send(std::string(bytes.data(), bytes.size())));
    std::vector<RpcResponse> answered(requests.size());
    msgpack::unpacker unpacker;
    for (std::size_t got = 0; got < responses;) {
        unpacker.reserve_buffer(65536);
        ssize_t length = ::recv(connection.fd(), unpacker.buffer(), 65536, 0);
        if (length <= 0)
            break;
        unpacker.buffer_consumed(std::size_t(length));
        for (msgpack::object_handle handle; unpacker.next(handle); ++got) {
            std::string reason;
            auto response = parseRpcResponse(*decodeMsgpack(handle.get(), reason), reason);
            answered[response->msgid] = *response;
        }
    }
    return answered;
}

inline std::string packed(const std::function<void(msgpack::packer<msgpack::sbuffer>&)>& write)
{
    msgpack::sbuffer buffer;
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    write(packer);
    return std::string(buffer.data(), buffer.size());
}

// A client of the library on the daemon's socket.
inline std::unique_ptr<mxr::Client> connectTo(const DaemonProcess& daemon)
{
    auto client = std::make_unique<mxr::Client>(daemon.socketPath().c_str());
    EXPECT_TRUE(client->open()) << mxr::errorText(client->error());
    return client;
}

// A report written as the tests write them, as the library takes it: nested values
// go as their JSON text.
inline mxr::Payload payloadOf(const Dictionary& dictionary)
{
    mxr::Payload payload;
    for (const auto& [key, value] : dictionary) {
        const char* name = key.c_str();
        if (const std::int64_t* integer = value.asInt())
            payload.add(name, *integer);
        else if (const double* real = value.asDouble())
            payload.add(name, *real);
        else if (const std::string* text = value.asString())
            payload.add(name, *text);
        else if (const bool* flag = value.asBool())
            payload.add(name, *flag);
        else
            payload.addJson(name, toJsonText(value).c_str());
    }
    return payload;
}

// The daemon's answer to reporterID:valid:, as the protocol words it.
// An asynchronous send that waits while the library holds all the asynchronous sends
// it may, as a program that sends faster than the daemon answers would: -EAGAIN when
// no room came within 2 s (the daemon holds its replies).
inline int sendAsyncPaced(mxr::Client& client, const mxr::Payload& payload, std::uint32_t category, std::uint16_t type,
                          const std::optional<std::vector<std::int64_t>>& reporterIDs, std::function<void(int)> done)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(2);
    for (;;) {
        int result = client.sendAsync(payload, category, type, reporterIDs, done);
        if (result != -EAGAIN || std::chrono::steady_clock::now() > deadline)
            return result;
        std::this_thread::yield();
    }
}

inline Dictionary validity(mxr::Client& client, std::int64_t reporterID)
{
    std::uint16_t type = 0;
    int found = client.isValid(reporterID, type);
    EXPECT_GE(found, 0) << mxr::errorText(found);
    return Dictionary{{"reporterID", found == 1 ? reporterID : 0}, {"serviceType", type}};
}

// A small tmpfs over `path` for as long as it lives, where this machine lets a test
// mount one (as root).
class Tmpfs {
public:
    Tmpfs(std::filesystem::path path, const std::string& options) : path_(std::move(path))
    {
        std::filesystem::create_directories(path_);
        mounted_ =
            ::system(fmt::format("mount -t tmpfs -o {} tmpfs '{}' 2>/dev/null", options, path_.string()).c_str()) == 0;
    }
    ~Tmpfs() { unmount(); }
    bool mounted() const { return mounted_; }
    bool remount(const std::string& options)
    {
        return ::system(fmt::format("mount -o remount,{} '{}'", options, path_.string()).c_str()) == 0;
    }
    void unmount()
    {
        if (std::exchange(mounted_, false))
            (void)::system(fmt::format("umount -l '{}'", path_.string()).c_str());
    }

private:
    std::filesystem::path path_;
    bool mounted_ = false;
};

} // namespace mx::testing
