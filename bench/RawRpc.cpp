#include "RawRpc.h"

#include <cstring>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "wire/MsgpackRpcDecoder.h"

namespace mx::bench {

int connectRaw(const std::filesystem::path& socket)
{
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socket.c_str(), sizeof(address.sun_path) - 1);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0)
        return fd;
    ::close(fd);
    return -1;
}

bool sendAll(int fd, const char* bytes, std::size_t size)
{
    while (size > 0) {
        ssize_t sent = ::send(fd, bytes, size, MSG_NOSIGNAL);
        if (sent <= 0)
            return false;
        bytes += sent;
        size -= static_cast<std::size_t>(sent);
    }
    return true;
}

bool readResponses(int fd, const std::function<bool(const RpcResponse&, std::chrono::steady_clock::time_point)>& handle)
{
    MsgpackRpcDecoder decoder;
    for (;;) {
        auto space = decoder.buffer();
        ssize_t got = ::read(fd, space.data(), space.size());
        if (got <= 0)
            return false;
        auto now = std::chrono::steady_clock::now();
        decoder.consumed(static_cast<std::size_t>(got));
        Value message;
        std::string reason;
        while (decoder.next(message, reason) == MsgpackRpcDecoder::Status::Message)
            if (auto response = parseRpcResponse(message, reason); response && !handle(*response, now))
                return true;
    }
}

} // namespace mx::bench
