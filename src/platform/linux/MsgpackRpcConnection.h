#pragma once
// One client connection of the listener: reads msgpack-rpc requests from the Unix
// stream socket, hands each (method name and parameters, whatever the method) to the
// exported object, and writes the replies back in whatever order they come. Bad input
// closes only this connection, with one log line. Back-pressure acts before a request
// arrives: the connection is not read while it has too many requests unanswered, too
// many reply bytes unsent, or while its client owes the service past its bound (the
// exported object says); other connections are read on. A pass hands on a bounded
// number of requests and lets the others' passes come between, so that requests
// arrive, and run, in the order the clients sent them rather than a pipeline at a time.
// Its socket's handlers run on a strand of its own (the socket's executor); replies may
// be sent from any thread.

#include <atomic>
#include <chrono>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>
#include <msgpack.hpp>

#include "platform/ServiceConnection.h"
#include "wire/MsgpackRpcDecoder.h"

namespace mx {

class MsgpackRpcConnection final : public ServiceConnection, public std::enable_shared_from_this<MsgpackRpcConnection> {
public:
    // Unsent reply bytes above which the client's requests are no longer read.
    static constexpr std::size_t kBackPressureBytes = std::size_t{4} << 20;
    // Requests handed on and waiting for work, in number and in wire bytes (a held
    // reply no longer counts): 256 keep a client's pipeline full without letting it
    // pile up more than its share of the daemon's queues.
    static constexpr std::size_t kMaximumRequestsInFlight = 256;
    static constexpr std::size_t kMaximumBytesInFlight = std::size_t{4} << 20;
    // Requests one pass hands on before the passes of other connections come: a
    // pipeline arrives in steps of this many, interleaved with everyone else's.
    static constexpr std::size_t kRequestsPerPass = 32;
    // How often a paused connection looks whether its client is still there.
    static constexpr std::chrono::milliseconds kHangUpWatchInterval{500};
    // A request whose bytes stop arriving for this long closes its connection; and all
    // requests still arriving, on every connection, hold at most this much (past it,
    // the connection whose request has waited longest is closed): a thousand clients
    // each a byte short of a large request hold neither memory nor descriptors for long.
    static constexpr std::chrono::seconds kTransitTimeout{10};
    static constexpr std::size_t kTransitBytes = std::size_t{64} << 20;
    // A reply batch starts this small: most hold a reply or two.
    static constexpr std::size_t kReplyBufferBytes = 512;

    MsgpackRpcConnection(asio::local::stream_protocol::socket socket, std::uint64_t number);
    ~MsgpackRpcConnection() override;

    pid_t processIdentifier() const override { return pid_; }
    std::string description() const override;
    void setExportedObject(std::shared_ptr<ServiceExportedObject> object) override;
    void setInterruptionHandler(std::function<void()> handler) override;
    void setInvalidationHandler(std::function<void()> handler) override;
    void resume() override;

    // Reads no further request, for good: the daemon is shutting down. What is in
    // flight is still answered. Returns once that holds. Any thread but the strand's.
    void stopReading();

    // Any thread: when the request now in transit began to arrive (the latest time
    // there is when none is).
    std::chrono::steady_clock::time_point transitBegan() const { return transitBegan_.load(std::memory_order_relaxed); }

    // Any thread. Dropped when the connection is gone.
    void sendResponse(std::uint32_t msgid, const Value& error, const Value& result);
    void sendError(std::uint32_t msgid, const ServiceError& error);
    // Any thread, once per request handed on: it was answered, or never will be.
    void requestEnded(std::size_t bytes);

private:
    void readMore();
    void handleRead(std::size_t bytes);
    void processBuffered();
    bool overBound() const;
    // Any thread: a paused connection looks at its bounds again, on its strand.
    void postResume();
    void resumeIfPaused();
    void watchForHangUp();
    bool handleMessage(const Value& message, std::size_t bytes);
    // A request has begun to arrive and holds `bytes` (0: none does).
    void inTransit(std::size_t bytes);
    void watchTransit(std::chrono::steady_clock::duration wait);
    void flushReplies();
    void enqueue(std::shared_ptr<msgpack::sbuffer> bytes);
    void writeMore();
    std::vector<asio::const_buffer> unsent() const;
    void drop(std::size_t sent);
    void close(const std::string& reason);

    asio::local::stream_protocol::socket socket_;
    std::uint64_t number_;
    pid_t pid_ = 0;
    uid_t uid_ = 0;

    // The strand's only.
    MsgpackRpcDecoder decoder_;
    std::shared_ptr<ServiceExportedObject> exported_;
    std::function<void()> interruptionHandler_;
    std::function<void()> invalidationHandler_;
    std::deque<std::shared_ptr<msgpack::sbuffer>> outbox_;
    std::size_t outboxBytes_ = 0;
    std::size_t writingBuffers_ = 0; // the front of the outbox that a write in progress covers
    std::size_t sentOfFront_ = 0;    // of the outbox's first buffer, written already
    bool reading_ = false;
    bool writing_ = false;
    bool resumed_ = false;
    bool stoppedReading_ = false;

    // Set on the strand before it checks the bounds once more, read by replying
    // threads after they lower them: one of the two always sees the other.
    std::atomic<bool> paused_{false};
    std::shared_ptr<MsgpackRpcConnection> holdWhilePaused_; // the strand's only
    std::optional<asio::steady_timer> hangUpWatch_;         // the strand's only
    // The request in transit, the strand's only: what it holds, when it last grew.
    std::size_t transitBytes_ = 0;
    std::chrono::steady_clock::time_point transitProgress_{};
    std::optional<asio::steady_timer> transitWatch_;
    // Read by other connections; the latest time there is while none is in transit.
    std::atomic<std::chrono::steady_clock::time_point> transitBegan_{std::chrono::steady_clock::time_point::max()};
    std::atomic<bool> resumePosted_{false};
    std::atomic<std::size_t> requestsInFlight_{0};
    std::atomic<std::size_t> bytesInFlight_{0};

    std::atomic<bool> closed_{false};

    // Replies encoded on other threads gather here; one hand-over to the strand
    // carries all that arrived meanwhile, so a busy connection costs one wake-up
    // per batch rather than per reply.
    std::mutex repliesMutex_;
    std::shared_ptr<msgpack::sbuffer> replies_;
    bool flushScheduled_ = false;
};

} // namespace mx
