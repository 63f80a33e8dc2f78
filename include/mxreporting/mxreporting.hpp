// libmxreporting for C++: owning wrappers over the C API of <mxreporting/mxreporting.h>,
// whose comments say what each call does. Header-only: it is compiled into the caller
// and reaches the library through its C ABI alone. Calls return what the C functions
// return: 0 or more on success, a negative errno (mxr::errorText says what it means).
// It needs C++17 or later.
#ifndef MXREPORTING_MXREPORTING_HPP
#define MXREPORTING_MXREPORTING_HPP

#if __cplusplus < 201703L
#error "<mxreporting/mxreporting.hpp> needs C++17 or later (-std=c++17); C++ before it can use <mxreporting/mxreporting.h>"
#endif

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <initializer_list>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include <mxreporting/mxreporting.h>

namespace mxr {

inline std::string errorText(int error) { return mxr_strerror(error); }

class Payload {
public:
    Payload() : payload_(mxr_payload_new())
    {
        if (!payload_)
            throw std::bad_alloc();
    }
    Payload(Payload&&) noexcept = default;
    Payload& operator=(Payload&&) noexcept = default;

    // Each returns what the C function does; a key added again replaces its value.
    // Any integer type, unsigned ones beyond INT64_MAX included.
    template <class Integer,
              std::enable_if_t<std::is_integral_v<Integer> && !std::is_same_v<Integer, bool>, int> = 0>
    int add(const char* key, Integer value)
    {
        if constexpr (std::is_unsigned_v<Integer>)
            if (static_cast<std::uint64_t>(value) > static_cast<std::uint64_t>(INT64_MAX))
                return mxr_payload_add_json(get(), key, std::to_string(value).c_str());
        return mxr_payload_add_int(get(), key, static_cast<std::int64_t>(value));
    }
    int add(const char* key, double value) { return mxr_payload_add_double(get(), key, value); }
    int add(const char* key, const char* value) { return mxr_payload_add_string(get(), key, value); }
    int add(const char* key, const std::string& value) { return mxr_payload_add_string(get(), key, value.c_str()); }
    int add(const char* key, bool value) { return mxr_payload_add_bool(get(), key, value ? 1 : 0); }
    int addJson(const char* key, const char* json) { return mxr_payload_add_json(get(), key, json); }

    mxr_payload* get() const { return payload_.get(); }

private:
    struct Free {
        void operator()(mxr_payload* payload) const { mxr_payload_free(payload); }
    };
    std::unique_ptr<mxr_payload, Free> payload_;
};

class Client {
public:
    // Opens a client on `socket` (nullptr: the daemon's). When it cannot, `open()` is
    // false and `error()` says why.
    explicit Client(const char* socket = nullptr)
    {
        mxr_client* client = nullptr;
        error_ = mxr_client_open(&client, socket);
        client_.reset(client);
    }
    Client(Client&&) noexcept = default;
    Client& operator=(Client&&) noexcept = default;

    bool open() const { return client_ != nullptr; }
    int error() const { return error_; }
    mxr_client* get() const { return client_.get(); }

    int setTimeout(std::chrono::microseconds timeout)
    {
        return mxr_client_set_timeout(get(), static_cast<std::uint64_t>(timeout.count()));
    }

    int createSession(std::int64_t reporterID) { return mxr_session_create(get(), reporterID); }
    int setServiceType(std::int64_t reporterID, std::uint16_t serviceType)
    {
        return mxr_session_set_service_type(get(), reporterID, serviceType);
    }
    int setConfiguration(std::int64_t reporterID, const Payload& configuration)
    {
        return mxr_session_set_configuration(get(), reporterID, configuration.get());
    }
    int startSession(std::int64_t reporterID) { return mxr_session_start(get(), reporterID); }
    int stopSession(std::int64_t reporterID) { return mxr_session_stop(get(), reporterID); }
    int destroySession(std::int64_t reporterID) { return mxr_session_destroy(get(), reporterID); }

    // No IDs (nullopt): every started session, or one standalone message.
    int send(const Payload& payload, std::uint32_t category, std::uint16_t type,
             const std::optional<std::vector<std::int64_t>>& reporterIDs)
    {
        return mxr_send(get(), payload.get(), category, type, reporterIDs ? reporterIDs->data() : nullptr,
                        reporterIDs ? reporterIDs->size() : 0);
    }
    int send(const Payload& payload, std::uint32_t category, std::uint16_t type,
             std::initializer_list<std::int64_t> reporterIDs)
    {
        return send(payload, category, type, std::vector<std::int64_t>(reporterIDs));
    }
    // `done` runs once on the library's thread with what send() would have returned.
    int sendAsync(const Payload& payload, std::uint32_t category, std::uint16_t type,
                  const std::optional<std::vector<std::int64_t>>& reporterIDs, std::function<void(int)> done)
    {
        auto* held = done ? new std::function<void(int)>(std::move(done)) : nullptr;
        int result = mxr_send_async(get(), payload.get(), category, type,
                                    reporterIDs ? reporterIDs->data() : nullptr, reporterIDs ? reporterIDs->size() : 0,
                                    held ? &Client::finished : nullptr, held);
        if (result < 0)
            delete held;
        return result;
    }
    int sendRealtime(std::int64_t reporterID, std::uint32_t category, std::uint16_t type, const mxr_field* fields,
                     std::size_t count)
    {
        return mxr_send_rt(get(), reporterID, category, type, fields, count);
    }

    // The service type of the session of that ID, 65535 when there is none; negative
    // on failure.
    int serviceType(std::int64_t reporterID)
    {
        std::uint16_t type = 0;
        int error = mxr_session_get_service_type(get(), reporterID, &type);
        return error < 0 ? error : type;
    }
    // 1 when a session of that ID exists in any client (its service type in
    // `serviceType`), 0 when none does; negative on failure.
    int isValid(std::int64_t reporterID, std::uint16_t& serviceType)
    {
        return mxr_session_is_valid(get(), reporterID, &serviceType);
    }
    int reporters(std::vector<std::int64_t>& out)
    {
        std::int64_t* ids = nullptr;
        std::size_t count = 0;
        int error = mxr_get_reporters(get(), &ids, &count);
        if (error < 0)
            return error;
        out.assign(ids, ids + count);
        std::free(ids);
        return 0;
    }
    int status(std::string& json)
    {
        char* text = nullptr;
        int error = mxr_get_status(get(), &text);
        if (error < 0)
            return error;
        json = text;
        std::free(text);
        return 0;
    }
    int killService() { return mxr_kill_service(get()); }

private:
    static void finished(int result, void* userdata)
    {
        std::unique_ptr<std::function<void(int)>> done(static_cast<std::function<void(int)>*>(userdata));
        (*done)(result);
    }

    struct Close {
        void operator()(mxr_client* client) const { mxr_client_close(client); }
    };
    std::unique_ptr<mxr_client, Close> client_;
    int error_ = 0;
};

// The block throttle: a burst of one message key delivers its last message, once.
class Throttle {
public:
    Throttle()
    {
        mxr_throttle* throttle = nullptr;
        if (mxr_throttle_new(&throttle) < 0)
            throw std::bad_alloc();
        throttle_.reset(throttle);
    }

    int submit(std::int64_t reporterID, const Payload& message, std::uint32_t category, std::uint16_t type,
               std::function<void()> deliver)
    {
        // The throttle releases it, whatever becomes of it.
        return mxr_throttle_submit(
            throttle_.get(), reporterID, message.get(), category, type,
            [](void* userdata) { (*static_cast<std::function<void()>*>(userdata))(); },
            [](void* userdata) { delete static_cast<std::function<void()>*>(userdata); },
            new std::function<void()>(std::move(deliver)));
    }
    // 0, or how many deliveries are still held after the 5 s wait.
    int wait() { return mxr_throttle_wait(throttle_.get()); }
    // The key a message is held under, and its throttle time.
    static int describe(const Payload& message, std::int64_t reporterID, std::uint32_t category, std::uint16_t type,
                        std::string& key, double& seconds)
    {
        char* text = nullptr;
        int error = mxr_throttle_describe(message.get(), reporterID, category, type, &text, &seconds);
        if (error < 0)
            return error;
        key = text;
        std::free(text);
        return 0;
    }
    // Ends it now: held deliveries are dropped, a running one is waited for.
    void end() { throttle_.reset(); }

private:
    struct Free {
        void operator()(mxr_throttle* throttle) const { mxr_throttle_free(throttle); }
    };
    std::unique_ptr<mxr_throttle, Free> throttle_;
};

} // namespace mxr

#endif
