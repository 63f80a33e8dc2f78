#pragma once
// One client's connection to the daemon, inside libmxreporting. Requests go out on
// the daemon's socket and replies are matched to them on the connection's own thread
// (an Asio context). When the connection breaks it is made again, with backoff, and
// the client's sessions are restored (MxReportingSessionRegistry) before anything
// else is sent; requests that were in flight are sent again, or fail with -ENOTCONN
// once their time is up.
// A request the daemon would refuse by closing the connection (too large, too deep)
// is refused here and never sent. Real-time reports come in through a ring
// (MxReportingRealtimeRing) that the thread drains while connected, a bounded number
// at a time: while the daemon is away they wait in the ring, and a full ring drops.
// Owned by the C API's client; every public call is safe from any thread.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <msgpack.hpp>

#include "client/MxReportingRealtimeRing.h"
#include "client/MxReportingSessionRegistry.h"
#include "value/Value.h"
#include "wire/MsgpackRpcDecoder.h"

namespace mx {

class MxReportingConnection {
public:
    // 0 with the reply's result, or a negative errno: -EINVAL for a request the daemon
    // refused (its error), -ENOTCONN for one that could not be sent in time.
    using Completion = std::function<void(int error, const Value& result)>;
    // A line of the library's own, with its syslog priority.
    using Log = std::function<void(int priority, const std::string& line)>;

    static constexpr std::chrono::milliseconds kFirstReconnect{50};
    static constexpr std::chrono::milliseconds kLongestReconnect{5000};
    static constexpr std::chrono::microseconds kDefaultTimeout = std::chrono::seconds(10);
    // A connection that lasted less than this, and answered nothing, broke at once: the
    // backoff goes on growing.
    static constexpr std::chrono::seconds kHealthy{2};
    // Real-time reports taken from the ring and not yet answered.
    static constexpr std::size_t kRealtimeOutstanding = 256;
    // What asynchronous sends may hold, waiting for a connection or a reply.
    static constexpr std::size_t kAsyncRequests = 4096;
    static constexpr std::size_t kAsyncBytes = std::size_t{16} << 20;

    // Connects, or returns nothing with the errno of the failure.
    static std::unique_ptr<MxReportingConnection> open(const std::filesystem::path& socket, Log log, int& error);
    // What is still waiting fails with -ENOTCONN, on the connection's thread, before
    // this returns.
    ~MxReportingConnection();
    MxReportingConnection(const MxReportingConnection&) = delete;
    MxReportingConnection& operator=(const MxReportingConnection&) = delete;

    void setTimeout(std::chrono::microseconds timeout) { timeout_.store(timeout.count()); }

    // Sends a request; `done`, when given, runs once on the connection's thread.
    // -EMSGSIZE or -EINVAL, with `done` never run, for a request the daemon would
    // refuse (larger than it reads, nested deeper); -EAGAIN, counted, when the
    // asynchronous sends already hold all they may.
    int callAsync(std::string_view method, Array params, Completion done);
    // The same, waiting for the reply up to the timeout. -EDEADLK from the
    // connection's own thread, where the reply could never come.
    int callAndWait(std::string_view method, Array params, Value& result, const MxReportingSessionEffect& effect = {});
    // A start: the daemon holds its reply until the session is stopped, so it is sent
    // and not waited for, and restoring the session starts it again rather than this.
    void start(std::int64_t reporterID);
    // A request nothing answers (killService): waits, up to the timeout, until it is
    // written. It is never sent again.
    int sendOneWay(std::string_view method, Array params);

    // Real-time reports: the ring's push, and what became of them.
    int sendRealtime(std::int64_t reporterID, std::uint32_t category, std::uint16_t type, const mxr_field* fields,
                     std::size_t count)
    {
        return ring_->push(reporterID, category, type, fields, count);
    }
    std::uint64_t realtimeSent() const { return realtimeSent_.load(); }
    std::uint64_t realtimeFailed() const { return realtimeFailed_.load(); }
    std::uint64_t realtimeDropped() const { return ring_->dropped(); }
    std::uint64_t asyncDropped() const { return asyncDropped_.load(); }

private:
    struct Request {
        std::uint64_t number; // the order it was made in
        std::string method;
        Array params;
        Completion done;
        std::chrono::steady_clock::time_point deadline; // for the wait on a connection
        bool held = false;                              // a start
        bool oneWay = false;                            // `done` once written
    };
    struct Outgoing {
        std::shared_ptr<msgpack::sbuffer> bytes;
        Completion written; // a one-way request's
    };

    MxReportingConnection(std::filesystem::path socket, Log log, std::unique_ptr<MxReportingRealtimeRing> ring);

    std::chrono::microseconds timeout() const { return std::chrono::microseconds(timeout_.load()); }
    // 0, or why the daemon would close the connection on this request.
    static int refusal(std::string_view method, const Array& params, std::size_t& bytes);
    // Connection thread only, below.
    int wait(Request request, Value& result, const MxReportingSessionEffect& effect);
    void submit(Request request, const MxReportingSessionEffect& effect);
    void failInFlight(int error);
    void cancel(std::uint64_t number);
    void send(Request request);
    void readMore();
    void deliver(const Value& message);
    // The errno of an error the daemon's connection layer answered with.
    static int errorOf(const Value& error);
    static constexpr std::int64_t kDaemonLimitCode = 3;
    void writeMore();
    void lose(const std::string& why);
    void reconnectLater();
    void reconnect();
    void restore();
    void failExpired();
    void watchRing();
    void resumeRing();
    std::size_t realtimeRoom() const;
    void takeRealtime(const MxReportingRealtimeRing::Report& report);
    void close();

    const std::filesystem::path socketPath_;
    const Log log_;
    std::unique_ptr<MxReportingRealtimeRing> ring_;
    std::atomic<std::int64_t> timeout_{kDefaultTimeout.count()};
    std::atomic<std::uint64_t> requests_{0};
    std::atomic<std::uint64_t> realtimeSent_{0};
    std::atomic<std::uint64_t> realtimeFailed_{0};
    std::atomic<std::size_t> asyncRequests_{0};
    std::atomic<std::size_t> asyncBytes_{0};
    std::atomic<std::uint64_t> asyncDropped_{0};

    asio::io_context io_;
    asio::executor_work_guard<asio::io_context::executor_type> keepRunning_;
    asio::local::stream_protocol::socket socket_;
    asio::steady_timer reconnectTimer_;
    asio::posix::stream_descriptor wake_;

    // The connection thread's, from here on.
    std::unique_ptr<MsgpackRpcDecoder> decoder_;
    MxReportingSessionRegistry registry_;
    std::deque<Request> unsent_;                // waiting for a connection, in order
    std::map<std::uint32_t, Request> inFlight_; // sent, by msgid
    std::deque<Outgoing> outbox_;
    std::uint32_t nextMsgid_ = 1;
    std::uint64_t generation_ = 0; // of the socket: one more for each connection lost
    std::chrono::milliseconds backoff_ = kFirstReconnect;
    std::chrono::steady_clock::time_point connectedAt_;
    bool answered_ = false;        // a reply came on this connection
    bool quietReconnects_ = false; // the breaks at once are said once
    std::size_t realtimeOutstanding_ = 0;
    bool ringPaused_ = false;
    bool connected_ = false;
    bool writing_ = false;
    bool closing_ = false;
    std::thread thread_;
};

} // namespace mx
