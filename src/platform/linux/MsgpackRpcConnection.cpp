#include "platform/linux/MsgpackRpcConnection.h"

#include <algorithm>
#include <future>
#include <map>

#include <poll.h>
#include <sys/socket.h>

#include <asio/buffer.hpp>
#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <asio/write.hpp>
#include <fmt/format.h>

#include "platform/MxLog.h"
#include "platform/linux/AsioHandOver.h"
#include "wire/MsgpackRpcMessage.h"

namespace mx {

namespace {

// Sends the first reply of one request and drops the rest: the protocol's own rules
// allow a second reply (and a reply after the client left).
class ConnectionReply final : public ServiceReply {
public:
    ConnectionReply(std::weak_ptr<MsgpackRpcConnection> connection, std::uint32_t msgid, std::size_t bytes)
        : connection_(std::move(connection)), msgid_(msgid), bytes_(bytes)
    {
    }

    // A request that is never answered (its client vanished, its reply was dropped)
    // leaves the connection's bounds here.
    ~ConnectionReply() override
    {
        if (!replied_.load())
            leaveBounds();
    }

    void respond(const Value& result) override
    {
        if (claim())
            if (auto connection = connection_.lock()) {
                connection->sendResponse(msgid_, Value(), result);
                leaveBounds();
            }
    }

    void fail(const ServiceError& error) override
    {
        if (claim())
            if (auto connection = connection_.lock()) {
                connection->sendError(msgid_, error);
                leaveBounds();
            }
    }

    void hold() override
    {
        if (!replied_.load())
            leaveBounds();
    }

private:
    bool claim() { return !replied_.exchange(true); }

    // Once, whether by its reply, its hold or its end.
    void leaveBounds()
    {
        if (counted_.exchange(false))
            if (auto connection = connection_.lock())
                connection->requestEnded(bytes_);
    }

    std::weak_ptr<MsgpackRpcConnection> connection_;
    std::uint32_t msgid_;
    std::size_t bytes_;
    std::atomic<bool> replied_{false};
    std::atomic<bool> counted_{true};
};

// The requests still arriving on every connection. Each connection keeps what its own
// request in transit holds; the total is counted here, and the connections are listed
// (from their first read to their close) so that the one waiting longest can be found
// when the total passes its bound. Thread-safe.
class RequestsInTransit {
public:
    void enter(const std::shared_ptr<MsgpackRpcConnection>& connection)
    {
        std::lock_guard lock(mutex_);
        connections_.emplace(connection.get(), connection);
    }
    void leave(const MsgpackRpcConnection* connection)
    {
        std::lock_guard lock(mutex_);
        connections_.erase(connection);
    }
    // What one connection's request in transit holds changed by `delta`: true when the
    // total is past the bound.
    bool grow(std::ptrdiff_t delta)
    {
        std::size_t total = total_.fetch_add(static_cast<std::size_t>(delta), std::memory_order_relaxed) +
            static_cast<std::size_t>(delta);
        return total > MsgpackRpcConnection::kTransitBytes;
    }
    // The connection whose request in transit began longest ago.
    std::shared_ptr<MsgpackRpcConnection> longest()
    {
        std::lock_guard lock(mutex_);
        std::shared_ptr<MsgpackRpcConnection> found;
        auto since = std::chrono::steady_clock::time_point::max();
        for (const auto& [raw, weak] : connections_)
            if (auto connection = weak.lock(); connection && connection->transitBegan() < since) {
                since = connection->transitBegan();
                found = std::move(connection);
            }
        return found;
    }

private:
    std::mutex mutex_;
    std::map<const MsgpackRpcConnection*, std::weak_ptr<MsgpackRpcConnection>> connections_;
    std::atomic<std::size_t> total_{0};
};

RequestsInTransit& requestsInTransit()
{
    static auto* transit = new RequestsInTransit; // outlives every connection
    return *transit;
}

} // namespace

MsgpackRpcConnection::MsgpackRpcConnection(asio::local::stream_protocol::socket socket, std::uint64_t number)
    : socket_(std::move(socket)), number_(number)
{
    // Writes are tried at once and must not wait for room (see writeMore).
    std::error_code ignored;
    socket_.non_blocking(true, ignored);
    ucred credentials{};
    socklen_t length = sizeof(credentials);
    if (getsockopt(socket_.native_handle(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) == 0) {
        pid_ = credentials.pid;
        uid_ = credentials.uid;
    }
}

MsgpackRpcConnection::~MsgpackRpcConnection() = default;

std::string MsgpackRpcConnection::description() const
{
    return fmt::format("<connection {} from pid {} uid {}>", number_, pid_, uid_);
}

void MsgpackRpcConnection::setExportedObject(std::shared_ptr<ServiceExportedObject> object)
{
    exported_ = std::move(object);
}

void MsgpackRpcConnection::setInterruptionHandler(std::function<void()> handler)
{
    interruptionHandler_ = std::move(handler);
}

void MsgpackRpcConnection::setInvalidationHandler(std::function<void()> handler)
{
    invalidationHandler_ = std::move(handler);
}

void MsgpackRpcConnection::resume()
{
    if (resumed_)
        return;
    resumed_ = true;
    requestsInTransit().enter(shared_from_this());
    readMore();
}

void MsgpackRpcConnection::stopReading()
{
    std::promise<void> stopped;
    asio::post(socket_.get_executor(), [&] {
        stoppedReading_ = true;
        stopped.set_value();
    });
    stopped.get_future().wait();
}

void MsgpackRpcConnection::readMore()
{
    if (reading_ || closed_)
        return;
    reading_ = true;
    auto space = decoder_.buffer();
    socket_.async_read_some(asio::buffer(space.data(), space.size()),
                            [self = shared_from_this()](const std::error_code& error, std::size_t bytes) {
                                self->reading_ = false;
                                if (error) {
                                    // The client closed or reset: the ordinary end of a connection.
                                    self->close({});
                                    return;
                                }
                                AsioHandOver handOver(self.get());
                                self->handleRead(bytes);
                            });
}

void MsgpackRpcConnection::handleRead(std::size_t bytes)
{
    decoder_.consumed(bytes);
    processBuffered();
}

bool MsgpackRpcConnection::overBound() const
{
    return stoppedReading_ || requestsInFlight_.load() >= kMaximumRequestsInFlight ||
        bytesInFlight_.load() >= kMaximumBytesInFlight || outboxBytes_ > kBackPressureBytes ||
        (exported_ && exported_->overdrawn());
}

// Decoded input waits in the decoder while a bound holds; the socket behind it fills,
// and the client's writes block.
void MsgpackRpcConnection::processBuffered()
{
    Value message;
    std::string reason;
    for (std::size_t handedOn = 0; !closed_;) {
        if (overBound()) {
            // No read is outstanding meanwhile, and maybe no write: the connection
            // holds itself until it reads again or closes.
            holdWhilePaused_ = shared_from_this();
            paused_.store(true);
            if (overBound()) {
                // Told when its client owes less; the other bounds are lowered by
                // replies and writes, which look at the pause themselves.
                if (exported_ && exported_->overdrawn())
                    exported_->whenSettled([weakSelf = weak_from_this()] {
                        if (auto self = weakSelf.lock())
                            self->postResume();
                    });
                watchForHangUp();
                return;
            }
            paused_.store(false);
            holdWhilePaused_.reset();
        }
        if (handedOn == kRequestsPerPass) {
            // The requests handed on run when this handler returns; the rest wait
            // behind the other connections' passes.
            asio::post(socket_.get_executor(), [self = shared_from_this()] {
                AsioHandOver handOver(self.get());
                self->processBuffered();
            });
            return;
        }
        switch (decoder_.next(message, reason)) {
        case MsgpackRpcDecoder::Status::NeedMore:
            inTransit(decoder_.partialBytes());
            readMore();
            return;
        case MsgpackRpcDecoder::Status::Bad:
            close(reason);
            return;
        case MsgpackRpcDecoder::Status::Message:
            if (!handleMessage(message, decoder_.lastMessageBytes()))
                return;
            ++handedOn;
            break;
        }
    }
}

// While paused no read is outstanding, so a client that leaves would go unnoticed
// until what it waits on completes, which may be never (held start replies): the
// socket is looked at now and then instead.
void MsgpackRpcConnection::watchForHangUp()
{
    if (hangUpWatch_.has_value() || closed_)
        return;
    hangUpWatch_.emplace(socket_.get_executor(), kHangUpWatchInterval);
    hangUpWatch_->async_wait([self = shared_from_this()](const std::error_code&) {
        self->hangUpWatch_.reset();
        if (self->closed_ || !self->paused_.load())
            return;
        pollfd descriptor{self->socket_.native_handle(), POLLRDHUP, 0};
        if (::poll(&descriptor, 1, 0) == 1 && (descriptor.revents & (POLLHUP | POLLRDHUP | POLLERR)) != 0) {
            self->close({});
            return;
        }
        self->watchForHangUp();
    });
}

// A request that has begun to arrive is watched until it has all arrived: its bytes
// must keep coming, and what all such requests hold together is bounded. Cheap on the
// way of every read: a count, and a timer armed once that looks again when it fires.
void MsgpackRpcConnection::inTransit(std::size_t bytes)
{
    if (bytes == transitBytes_)
        return;
    auto now = std::chrono::steady_clock::now();
    if (transitBytes_ == 0 || bytes == 0)
        transitBegan_.store(bytes == 0 ? std::chrono::steady_clock::time_point::max() : now, std::memory_order_relaxed);
    transitProgress_ = now;
    bool past =
        requestsInTransit().grow(static_cast<std::ptrdiff_t>(bytes) - static_cast<std::ptrdiff_t>(transitBytes_));
    transitBytes_ = bytes;
    if (past)
        if (auto longest = requestsInTransit().longest())
            asio::post(longest->socket_.get_executor(), [longest] {
                if (longest->transitBytes_ > 0)
                    longest->close(fmt::format(
                        "requests still arriving hold more than {} MiB in all, and this one has waited longest",
                        kTransitBytes >> 20));
            });
    if (bytes > 0 && !transitWatch_)
        watchTransit(kTransitTimeout);
}

void MsgpackRpcConnection::watchTransit(std::chrono::steady_clock::duration wait)
{
    transitWatch_.emplace(socket_.get_executor(), wait);
    transitWatch_->async_wait([weakSelf = weak_from_this()](const std::error_code& cancelled) {
        auto self = weakSelf.lock();
        if (cancelled || !self || self->closed_)
            return;
        self->transitWatch_.reset();
        if (self->transitBytes_ == 0)
            return;
        auto stalled = std::chrono::steady_clock::now() - self->transitProgress_;
        if (stalled >= kTransitTimeout)
            self->close(fmt::format("a request stopped arriving for {} s", kTransitTimeout.count()));
        else
            self->watchTransit(kTransitTimeout - stalled);
    });
}

void MsgpackRpcConnection::resumeIfPaused()
{
    if (!paused_.exchange(false))
        return;
    auto self = std::move(holdWhilePaused_);
    processBuffered();
}

void MsgpackRpcConnection::requestEnded(std::size_t bytes)
{
    requestsInFlight_.fetch_sub(1);
    bytesInFlight_.fetch_sub(bytes);
    postResume();
}

void MsgpackRpcConnection::postResume()
{
    if (!paused_.load() || resumePosted_.exchange(true))
        return;
    asio::post(socket_.get_executor(), [self = shared_from_this()] {
        self->resumePosted_.store(false);
        AsioHandOver handOver(self.get());
        self->resumeIfPaused();
    });
}

bool MsgpackRpcConnection::handleMessage(const Value& message, std::size_t bytes)
{
    inTransit(0);
    std::string reason;
    auto request = parseRpcRequest(message, reason);
    if (!request) {
        close(reason);
        return false;
    }
    requestsInFlight_.fetch_add(1);
    bytesInFlight_.fetch_add(bytes);
    auto reply = std::make_shared<ConnectionReply>(weak_from_this(), request->msgid, bytes);
    if (!exported_) {
        reply->fail({kServiceErrorUnknownMethod, "nothing is exported on this connection"});
        return true;
    }
    exported_->handleRequest(request->method, request->params ? &*request->params : nullptr, std::move(reply));
    return true;
}

void MsgpackRpcConnection::sendResponse(std::uint32_t msgid, const Value& error, const Value& result)
{
    if (closed_)
        return;
    {
        // Encoded on the replying thread, so the strand only writes.
        std::lock_guard lock(repliesMutex_);
        if (!replies_)
            replies_ = std::make_shared<msgpack::sbuffer>(kReplyBufferBytes);
        encodeRpcResponse(*replies_, msgid, error, result);
        if (std::exchange(flushScheduled_, true))
            return;
    }
    // Replies go together: those of a read pass's requests, run when the pass ends, in
    // one write; others when the handler that made them returns.
    auto flush = [self = shared_from_this()] {
        self->flushReplies();
    };
    if (auto* pass = AsioHandOver::ownedBy(this)) {
        pass->add(std::move(flush));
        return;
    }
    auto* handOver = AsioHandOver::takingFrom(this, static_cast<asio::io_context&>(socket_.get_executor().context()));
    if (handOver == nullptr) {
        asio::post(socket_.get_executor(), std::move(flush));
        return;
    }
    handOver->add([executor = socket_.get_executor(), flush = std::move(flush)]() mutable {
        asio::dispatch(executor, std::move(flush));
    });
}

void MsgpackRpcConnection::flushReplies()
{
    std::shared_ptr<msgpack::sbuffer> replies;
    {
        std::lock_guard lock(repliesMutex_);
        replies.swap(replies_);
        flushScheduled_ = false;
    }
    if (replies)
        enqueue(std::move(replies));
}

void MsgpackRpcConnection::sendError(std::uint32_t msgid, const ServiceError& error)
{
    sendResponse(msgid, Dictionary{{"code", error.code}, {"message", error.message}}, Value());
}

void MsgpackRpcConnection::enqueue(std::shared_ptr<msgpack::sbuffer> bytes)
{
    if (closed_)
        return;
    outboxBytes_ += bytes->size();
    // Behind a write in progress, replies gather in one buffer: a client that reads
    // nothing holds its bound in bytes, not a buffer for every handful of replies.
    if (outbox_.size() > writingBuffers_ && outbox_.back()->size() < kBackPressureBytes)
        outbox_.back()->write(bytes->data(), bytes->size());
    else
        outbox_.push_back(std::move(bytes));
    writeMore();
}

// Everything queued goes out in one gathered write, at once when the socket takes it
// (the usual case: no pass through the event loop), and what it does not take goes in
// the background.
void MsgpackRpcConnection::writeMore()
{
    if (writing_ || closed_ || outbox_.empty())
        return;
    std::error_code refused;
    std::size_t taken = socket_.write_some(unsent(), refused);
    if (refused && refused != asio::error::would_block) {
        close({});
        return;
    }
    drop(taken);
    if (outbox_.empty()) {
        resumeIfPaused();
        return;
    }
    writing_ = true;
    writingBuffers_ = outbox_.size();
    asio::async_write(socket_, unsent(), [self = shared_from_this()](const std::error_code& error, std::size_t sent) {
        self->writing_ = false;
        self->writingBuffers_ = 0;
        if (self->closed_)
            return;
        if (error) {
            self->close({});
            return;
        }
        self->drop(sent);
        self->writeMore();
        self->resumeIfPaused();
    });
}

std::vector<asio::const_buffer> MsgpackRpcConnection::unsent() const
{
    std::vector<asio::const_buffer> buffers;
    buffers.reserve(outbox_.size());
    for (const auto& bytes : outbox_)
        buffers.emplace_back(bytes->data(), bytes->size());
    buffers.front() += sentOfFront_;
    return buffers;
}

void MsgpackRpcConnection::drop(std::size_t sent)
{
    outboxBytes_ -= sent;
    sent += sentOfFront_;
    while (!outbox_.empty() && sent >= outbox_.front()->size()) {
        sent -= outbox_.front()->size();
        outbox_.pop_front();
    }
    sentOfFront_ = sent;
}

void MsgpackRpcConnection::close(const std::string& reason)
{
    if (closed_.exchange(true))
        return;
    if (!reason.empty())
        MXLOG_LIMITED(nullptr, Error, "closing connection of pid {}: {}", pid_, reason);
    std::error_code ignored;
    socket_.shutdown(asio::socket_base::shutdown_both, ignored);
    socket_.close(ignored);
    // The outbox stays until the connection goes: a write in flight still points into it.
    transitWatch_.reset();
    requestsInTransit().grow(-static_cast<std::ptrdiff_t>(std::exchange(transitBytes_, 0)));
    requestsInTransit().leave(this);
    if (auto handler = std::move(invalidationHandler_))
        handler();
    // The exported object goes only after the handler, which may still need it.
    exported_.reset();
    interruptionHandler_ = nullptr;
    holdWhilePaused_.reset();
}

} // namespace mx
