// libmxreporting's C ABI: every mxr_ function of <mxreporting/mxreporting.h>, over the
// library's connection (MxReportingConnection) and the block throttle. Nothing thrown
// inside crosses it: each function turns what it catches into a negative errno.

#include "mxreporting/mxreporting.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <new>
#include <string>
#include <sys/un.h>
#include <syslog.h>

#include <nlohmann/json.hpp>

#include "Statistics/Service/MxReportingBlockThrottle.h"
#include "client/MxReportingConnection.h"
#include "platform/MxLog.h"
#include "value/JsonValue.h"
#include "wire/MxReportingMethods.h"
#include "wire/RootPath.h"

using namespace mx;

struct mxr_client {
    std::unique_ptr<MxReportingConnection> connection;
};

struct mxr_payload {
    Dictionary dictionary;
};

struct mxr_throttle {
    std::shared_ptr<MxReportingBlockThrottle> throttle;
};

namespace {

// Where the library's lines go: the caller's function, or standard error.
struct LogDestination {
    std::mutex mutex;
    mxr_log_function function = nullptr;
    void* userdata = nullptr;
};

LogDestination& logDestination()
{
    static auto* destination = new LogDestination; // outlives every thread that logs
    return *destination;
}

void writeLog(int priority, const std::string& line)
{
    auto& destination = logDestination();
    std::lock_guard lock(destination.mutex);
    if (destination.function)
        destination.function(priority, line.c_str(), destination.userdata);
    else if (priority <= LOG_NOTICE)
        std::fprintf(stderr, "mxreporting: %s\n", line.c_str());
}

// The throttle writes through the daemon's logging facility; inside the library its
// lines go where the library's do.
class LibraryLogSink final : public MxLogSink {
public:
    void write(const MxLogRecord& record) override
    {
        static constexpr int kPriorities[] = {LOG_DEBUG, LOG_INFO, LOG_NOTICE, LOG_ERR};
        writeLog(kPriorities[static_cast<int>(record.level)], record.text);
    }
};

void installLibraryLog()
{
    static std::once_flag once;
    std::call_once(once, [] {
        static LibraryLogSink sink;
        ProcessWide<MxLogSink>::install(&sink);
    });
}

// Runs `body`, turning what it throws into a negative errno.
template <class Body>
int guarded(Body&& body) noexcept
{
    try {
        return body();
    } catch (const std::bad_alloc&) {
        return -ENOMEM;
    } catch (...) {
        return -EIO;
    }
}

// A reply that must be true (the session operations).
int expectTrue(int error, const Value& result)
{
    if (error < 0)
        return error;
    return result.asBool() && *result.asBool() ? 0 : -EPROTO;
}

// What a message's reply says: taken, refused because reporting is off, or neither.
int sendOutcome(int error, const Value& result)
{
    if (error < 0)
        return error;
    if (result.isNil())
        return 0;
    const Dictionary* refusal = result.asDictionary();
    const Value* code = refusal ? refusal->find("code") : nullptr;
    return code && code->int64Value() == 1 ? -EPERM : -EPROTO;
}

Value reporterIDs(const std::int64_t* ids, std::size_t count)
{
    if (!ids)
        return Value();
    return Array(std::vector<Value>(ids, ids + count));
}

int addValue(mxr_payload* p, const char* key, Value value)
{
    if (!p || !key)
        return -EINVAL;
    return guarded([&] {
        p->dictionary.set(key, std::move(value));
        return 0;
    });
}

using Kind = MxReportingSessionEffect::Kind;

int sessionCall(mxr_client* c, std::string_view method, Array params, const MxReportingSessionEffect& effect)
{
    if (!c)
        return -EINVAL;
    return guarded([&] {
        Value result;
        int error = c->connection->callAndWait(method, std::move(params), result, effect);
        return expectTrue(error, result);
    });
}

int query(mxr_client* c, std::string_view method, Array params, Value& result)
{
    if (!c)
        return -EINVAL;
    return guarded([&] { return c->connection->callAndWait(method, std::move(params), result); });
}

} // namespace

extern "C" {

int mxr_client_open(mxr_client** ret, const char* socket_path)
{
    if (!ret)
        return -EINVAL;
    return guarded([&] {
        std::filesystem::path socket =
            socket_path ? std::filesystem::path(socket_path) : MxReportingPath(kServiceSocketPath);
        if (socket.native().size() >= sizeof(sockaddr_un::sun_path))
            return -ENAMETOOLONG;
        int error = 0;
        auto connection = MxReportingConnection::open(socket, writeLog, error);
        if (!connection)
            return -error;
        *ret = new mxr_client{std::move(connection)};
        return 0;
    });
}

void mxr_client_close(mxr_client* c) { delete c; }

int mxr_client_set_timeout(mxr_client* c, uint64_t usec)
{
    if (!c || usec == 0)
        return -EINVAL;
    c->connection->setTimeout(std::chrono::microseconds(usec));
    return 0;
}

const char* mxr_strerror(int error)
{
    switch (-error) {
    case 0:
        return "Success";
    case EINVAL:
        return "Invalid argument, or a request the daemon cannot take";
    case ENOMEM:
        return "Out of memory";
    case ETIMEDOUT:
        return "No reply from the daemon in time";
    case ENOTCONN:
        return "Not sent: no connection to the daemon in time, or the client is closing";
    case EPROTO:
        return "A reply of the wrong shape from the daemon";
    case EPERM:
        return "Reporting is switched off on this host: nothing was sent";
    case EAGAIN:
        return "The real-time ring, or what asynchronous sends may hold, is full: the report was dropped";
    case EMSGSIZE:
        return "The report is larger than a real-time ring slot, or than a request the daemon reads (1 MiB)";
    case ENAMETOOLONG:
        return "The socket path is longer than a Unix socket address holds";
    case EDEADLK:
        return "A synchronous call from the library's own thread (a callback), where its reply cannot come";
    case ECONNREFUSED:
        return "Nobody listens on the daemon's socket (is mxreportingd running?)";
    case ENOENT:
        return "The daemon's socket does not exist (is mxreportingd running?)";
    case EACCES:
        return "Permission denied on the daemon's socket (is the user in its group?)";
    case EMFILE:
        return "The daemon holds as many sessions as it takes: none was made";
    case E2BIG:
        return "More reporter IDs than one message may name: nothing was sent";
    case ENOSPC:
        return "A session the message reaches keeps as much as it may this period: nothing was sent";
    default: {
        const char* text = strerrordesc_np(-error);
        return text ? text : "Unknown error";
    }
    }
}

mxr_payload* mxr_payload_new(void) { return new (std::nothrow) mxr_payload; }

void mxr_payload_free(mxr_payload* p) { delete p; }

int mxr_payload_add_int(mxr_payload* p, const char* key, int64_t value) { return addValue(p, key, value); }

int mxr_payload_add_double(mxr_payload* p, const char* key, double value) { return addValue(p, key, value); }

int mxr_payload_add_string(mxr_payload* p, const char* key, const char* value)
{
    if (!value)
        return -EINVAL;
    return guarded([&] { return addValue(p, key, std::string(value)); });
}

int mxr_payload_add_bool(mxr_payload* p, const char* key, int value) { return addValue(p, key, value != 0); }

int mxr_payload_add_json(mxr_payload* p, const char* key, const char* json)
{
    if (!json)
        return -EINVAL;
    return guarded([&] {
        auto parsed = nlohmann::ordered_json::parse(json, nullptr, /*allow_exceptions=*/false);
        if (parsed.is_discarded())
            return -EINVAL;
        return addValue(p, key, fromJson(parsed));
    });
}

int mxr_session_create(mxr_client* c, int64_t reporter_id)
{
    return sessionCall(c, method::kCreateReportingSession, Array{reporter_id}, {Kind::Create, reporter_id, 0, {}});
}

int mxr_session_set_service_type(mxr_client* c, int64_t reporter_id, uint16_t service_type)
{
    return sessionCall(c, method::kSetServiceType, Array{service_type, reporter_id},
                       {Kind::SetServiceType, reporter_id, service_type, {}});
}

int mxr_session_set_configuration(mxr_client* c, int64_t reporter_id, const mxr_payload* configuration)
{
    Dictionary merged = configuration ? configuration->dictionary : Dictionary();
    Value sent = configuration ? Value(merged) : Value();
    return sessionCall(c, method::kSetConfiguration, Array{sent, reporter_id},
                       {Kind::SetConfiguration, reporter_id, 0, std::move(merged)});
}

int mxr_session_start(mxr_client* c, int64_t reporter_id)
{
    if (!c)
        return -EINVAL;
    return guarded([&] {
        c->connection->start(reporter_id);
        return 0;
    });
}

int mxr_session_stop(mxr_client* c, int64_t reporter_id)
{
    return sessionCall(c, method::kStopReportingSessionForID, Array{reporter_id}, {Kind::Stop, reporter_id, 0, {}});
}

int mxr_session_destroy(mxr_client* c, int64_t reporter_id)
{
    return sessionCall(c, method::kDestroyReportingSession, Array{reporter_id}, {Kind::Destroy, reporter_id, 0, {}});
}

int mxr_send(mxr_client* c, const mxr_payload* p, uint32_t category, uint16_t type, const int64_t* reporter_ids,
             size_t n_reporter_ids)
{
    if (!c || !p || (n_reporter_ids > 0 && !reporter_ids))
        return -EINVAL;
    return guarded([&] {
        Value result;
        int error = c->connection->callAndWait(
            method::kSendMessage, Array{p->dictionary, category, type, reporterIDs(reporter_ids, n_reporter_ids)},
            result);
        return sendOutcome(error, result);
    });
}

int mxr_send_async(mxr_client* c, const mxr_payload* p, uint32_t category, uint16_t type, const int64_t* reporter_ids,
                   size_t n_reporter_ids, mxr_send_done done, void* userdata)
{
    if (!c || !p || (n_reporter_ids > 0 && !reporter_ids))
        return -EINVAL;
    return guarded([&] {
        MxReportingConnection::Completion completion;
        if (done)
            completion = [done, userdata](int error, const Value& result) {
                done(sendOutcome(error, result), userdata);
            };
        return c->connection->callAsync(method::kSendMessage,
                                        Array{p->dictionary, category, type, reporterIDs(reporter_ids, n_reporter_ids)},
                                        std::move(completion));
    });
}

int mxr_send_rt(mxr_client* c, int64_t reporter_id, uint32_t category, uint16_t type, const mxr_field* fields,
                size_t n_fields)
{
    if (!c)
        return -EINVAL;
    return c->connection->sendRealtime(reporter_id, category, type, fields, n_fields);
}

int mxr_client_get_rt_counts(mxr_client* c, uint64_t* ret_sent, uint64_t* ret_dropped, uint64_t* ret_failed)
{
    if (!c)
        return -EINVAL;
    if (ret_sent)
        *ret_sent = c->connection->realtimeSent();
    if (ret_dropped)
        *ret_dropped = c->connection->realtimeDropped();
    if (ret_failed)
        *ret_failed = c->connection->realtimeFailed();
    return 0;
}

int mxr_client_get_async_dropped(mxr_client* c, uint64_t* ret_dropped)
{
    if (!c || !ret_dropped)
        return -EINVAL;
    *ret_dropped = c->connection->asyncDropped();
    return 0;
}

int mxr_session_get_service_type(mxr_client* c, int64_t reporter_id, uint16_t* ret_service_type)
{
    if (!ret_service_type)
        return -EINVAL;
    Value result;
    int error = query(c, method::kGetServiceNameForReporterID, Array{reporter_id}, result);
    if (error < 0)
        return error;
    if (!result.isNumber() || result.int64Value() < 0 || result.int64Value() > 0xFFFF)
        return -EPROTO;
    *ret_service_type = static_cast<uint16_t>(result.int64Value());
    return 0;
}

int mxr_session_is_valid(mxr_client* c, int64_t reporter_id, uint16_t* ret_service_type)
{
    Value result;
    int error = query(c, method::kReporterIDValid, Array{reporter_id}, result);
    if (error < 0)
        return error;
    const Dictionary* validity = result.asDictionary();
    const Value* found = validity ? validity->find("reporterID") : nullptr;
    const Value* type = validity ? validity->find("serviceType") : nullptr;
    if (!found || !type)
        return -EPROTO;
    if (ret_service_type)
        *ret_service_type = static_cast<uint16_t>(type->int64Value());
    return found->int64Value() != 0 ? 1 : 0;
}

int mxr_get_reporters(mxr_client* c, int64_t** ret_ids, size_t* ret_n_ids)
{
    if (!ret_ids || !ret_n_ids)
        return -EINVAL;
    Value result;
    int error = query(c, method::kGetAllReporters, Array(), result);
    if (error < 0)
        return error;
    const Array* reporters = result.asArray();
    if (!reporters)
        return -EPROTO;
    auto* ids = static_cast<int64_t*>(std::malloc(std::max<std::size_t>(1, reporters->size()) * sizeof(int64_t)));
    if (!ids)
        return -ENOMEM;
    for (std::size_t i = 0; i < reporters->size(); ++i)
        ids[i] = (*reporters)[i].int64Value();
    *ret_ids = ids;
    *ret_n_ids = reporters->size();
    return 0;
}

int mxr_get_status(mxr_client* c, char** ret_json)
{
    if (!ret_json)
        return -EINVAL;
    Value result;
    int error = query(c, method::kStatus, Array(), result);
    if (error < 0)
        return error;
    if (!result.asDictionary())
        return -EPROTO;
    return guarded([&] {
        std::string text = toJsonText(result);
        char* copy = strdup(text.c_str());
        if (!copy)
            return -ENOMEM;
        *ret_json = copy;
        return 0;
    });
}

int mxr_kill_service(mxr_client* c)
{
    if (!c)
        return -EINVAL;
    return guarded([&] { return c->connection->sendOneWay(method::kKillService, Array()); });
}

int mxr_throttle_new(mxr_throttle** ret)
{
    if (!ret)
        return -EINVAL;
    return guarded([&] {
        installLibraryLog();
        *ret = new mxr_throttle{MxReportingBlockThrottle::make()};
        return 0;
    });
}

int mxr_throttle_submit(mxr_throttle* t, int64_t reporter_id, const mxr_payload* message, uint32_t category,
                        uint16_t type, mxr_throttle_deliver deliver, mxr_throttle_release release, void* userdata)
{
    // Released when the last copy of the delivery goes: after it ran, or once it was
    // replaced or dropped, or at once when it cannot be taken.
    std::shared_ptr<void> held;
    try {
        held = std::shared_ptr<void>(userdata, [release](void* data) {
            if (release)
                release(data);
        });
    } catch (...) {
        if (release)
            release(userdata);
        return -ENOMEM;
    }
    if (!t || !message || !deliver)
        return -EINVAL;
    return guarded([&] {
        t->throttle->addMessageBlock([deliver, held] { deliver(held.get()); }, reporter_id, message->dictionary,
                                     category, type);
        return 0;
    });
}

int mxr_throttle_wait(mxr_throttle* t)
{
    if (!t)
        return -EINVAL;
    return guarded([&] {
        t->throttle->waitForCompletion();
        return static_cast<int>(t->throttle->held());
    });
}

void mxr_throttle_free(mxr_throttle* t)
{
    if (!t)
        return;
    try {
        t->throttle->invalidate();
    } catch (...) {
        // Ending it goes on: what it held is dropped all the same.
    }
    delete t;
}

int mxr_throttle_describe(const mxr_payload* message, int64_t reporter_id, uint32_t category, uint16_t type,
                          char** ret_key, double* ret_seconds)
{
    if (!message || !ret_key)
        return -EINVAL;
    return guarded([&] {
        installLibraryLog();
        std::string key = MxReportingBlockThrottle::buildMessageKey(message->dictionary, reporter_id, category, type);
        if (ret_seconds)
            *ret_seconds = MxReportingBlockThrottle::determineSleepTime(message->dictionary);
        char* copy = strdup(key.c_str());
        if (!copy)
            return -ENOMEM;
        *ret_key = copy;
        return 0;
    });
}

void mxr_set_log_function(mxr_log_function log, void* userdata)
{
    auto& destination = logDestination();
    std::lock_guard lock(destination.mutex);
    destination.function = log;
    destination.userdata = userdata;
}

} // extern "C"
