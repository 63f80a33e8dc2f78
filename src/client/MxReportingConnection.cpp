#include "client/MxReportingConnection.h"

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <mutex>
#include <syslog.h>
#include <unistd.h>

#include <asio/connect.hpp>
#include <asio/post.hpp>
#include <asio/write.hpp>

#include "wire/MsgpackRpcMessage.h"
#include "wire/MsgpackValue.h"
#include "wire/MxReportingMethods.h"

namespace mx {

namespace {

using Clock = std::chrono::steady_clock;

// Levels of containers, the value's own included: a number is 1, [1] is 2.
std::size_t nestingOf(const Value& value)
{
    std::size_t deepest = 0;
    if (const Array* items = value.asArray())
        for (const auto& item : *items)
            deepest = std::max(deepest, nestingOf(item));
    else if (const Dictionary* entries = value.asDictionary())
        for (const auto& [key, item] : *entries)
            deepest = std::max(deepest, nestingOf(item));
    else
        return 1;
    return deepest + 1;
}

// Where a synchronous call's reply is waited for.
struct Reply {
    std::mutex mutex;
    std::condition_variable arrived;
    bool done = false;
    int error = 0;
    Value result;
};

} // namespace

std::unique_ptr<MxReportingConnection> MxReportingConnection::open(const std::filesystem::path& socket, Log log,
                                                                   int& error)
{
    auto ring = MxReportingRealtimeRing::make(error);
    if (!ring)
        return nullptr;
    std::unique_ptr<MxReportingConnection> connection(
        new MxReportingConnection(socket, std::move(log), std::move(ring)));
    std::error_code failure;
    connection->socket_.connect(asio::local::stream_protocol::endpoint(socket.string()), failure);
    if (failure) {
        error = failure.value();
        return nullptr;
    }
    connection->connected_ = true;
    connection->connectedAt_ = Clock::now();
    connection->readMore();
    connection->watchRing();
    connection->thread_ = std::thread([raw = connection.get()] { raw->io_.run(); });
    return connection;
}

MxReportingConnection::MxReportingConnection(std::filesystem::path socket, Log log,
                                             std::unique_ptr<MxReportingRealtimeRing> ring)
    : socketPath_(std::move(socket)),
      log_(std::move(log)),
      ring_(std::move(ring)),
      keepRunning_(io_.get_executor()),
      socket_(io_),
      reconnectTimer_(io_),
      wake_(io_, ::dup(ring_->wakeDescriptor())),
      decoder_(std::make_unique<MsgpackRpcDecoder>())
{
}

MxReportingConnection::~MxReportingConnection()
{
    asio::post(io_, [this] { close(); });
    keepRunning_.reset();
    if (thread_.joinable())
        thread_.join();
}

// What the daemon's reader closes a connection on: a request larger than it reads, or
// nested deeper than it decodes (the request's array and its parameters' count).
int MxReportingConnection::refusal(std::string_view method, const Array& params, std::size_t& bytes)
{
    bytes = encodedMsgpackBytes(Value(Array{0, std::uint32_t{0xFFFFFFFF}, std::string(method), params}));
    if (bytes > kMsgpackRpcMaximumMessageBytes)
        return -EMSGSIZE;
    std::size_t depth = 0;
    for (const auto& parameter : params)
        depth = std::max(depth, nestingOf(parameter));
    return depth + 2 > kMsgpackMaximumDepth ? -EINVAL : 0;
}

int MxReportingConnection::callAsync(std::string_view method, Array params, Completion done)
{
    std::size_t bytes = 0;
    if (int refused = refusal(method, params, bytes))
        return refused;
    bool room = asyncRequests_.fetch_add(1) < kAsyncRequests;
    room = asyncBytes_.fetch_add(bytes) + bytes <= kAsyncBytes && room;
    if (!room) {
        asyncRequests_.fetch_sub(1);
        asyncBytes_.fetch_sub(bytes);
        ++asyncDropped_;
        return -EAGAIN;
    }
    Completion counted = [this, bytes, done = std::move(done)](int error, const Value& result) {
        asyncRequests_.fetch_sub(1);
        asyncBytes_.fetch_sub(bytes);
        if (done)
            done(error, result);
    };
    Request request{++requests_, std::string(method), std::move(params), std::move(counted), Clock::now() + timeout()};
    asio::post(io_, [this, request = std::move(request)]() mutable { submit(std::move(request), {}); });
    return 0;
}

int MxReportingConnection::callAndWait(std::string_view method, Array params, Value& result,
                                       const MxReportingSessionEffect& effect)
{
    return wait(Request{0, std::string(method), std::move(params), nullptr, {}}, result, effect);
}

int MxReportingConnection::sendOneWay(std::string_view method, Array params)
{
    Value ignored;
    return wait(Request{0, std::string(method), std::move(params), nullptr, {}, false, true}, ignored, {});
}

int MxReportingConnection::wait(Request request, Value& result, const MxReportingSessionEffect& effect)
{
    if (std::this_thread::get_id() == thread_.get_id())
        return -EDEADLK;
    std::size_t bytes = 0;
    if (int refused = refusal(request.method, request.params, bytes))
        return refused;
    auto reply = std::make_shared<Reply>();
    std::uint64_t number = ++requests_;
    request.number = number;
    request.deadline = Clock::now() + timeout();
    request.done = [reply](int error, const Value& value) {
        std::lock_guard lock(reply->mutex);
        reply->done = true;
        reply->error = error;
        reply->result = value;
        reply->arrived.notify_all();
    };
    asio::post(io_, [this, request = std::move(request), effect]() mutable { submit(std::move(request), effect); });
    std::unique_lock lock(reply->mutex);
    if (!reply->arrived.wait_for(lock, timeout(), [&] { return reply->done; })) {
        // Not sent yet, it never will be: a caller told it failed must not see it taken.
        asio::post(io_, [this, number] { cancel(number); });
        return -ETIMEDOUT;
    }
    result = std::move(reply->result);
    return reply->error;
}

void MxReportingConnection::start(std::int64_t reporterID)
{
    Request request{++requests_,
                    std::string(method::kStartReportingSessionForID),
                    Array{reporterID},
                    nullptr,
                    Clock::now() + timeout(),
                    true};
    MxReportingSessionEffect effect{MxReportingSessionEffect::Kind::Start, reporterID, 0, {}};
    asio::post(io_, [this, request = std::move(request), effect = std::move(effect)]() mutable {
        submit(std::move(request), effect);
    });
}

void MxReportingConnection::submit(Request request, const MxReportingSessionEffect& effect)
{
    if (closing_) {
        if (request.done)
            request.done(-ENOTCONN, Value());
        return;
    }
    // A create the daemon refuses made nothing to restore.
    if (std::uint64_t created = registry_.apply(effect))
        request.done = [this, reporterID = effect.reporterID, created,
                        done = std::move(request.done)](int error, const Value& result) {
            if (error == -EMFILE || error == -EINVAL)
                registry_.forget(reporterID, created);
            if (done)
                done(error, result);
        };
    if (connected_)
        send(std::move(request));
    else
        unsent_.push_back(std::move(request));
}

void MxReportingConnection::cancel(std::uint64_t number)
{
    std::erase_if(unsent_, [&](const Request& request) { return request.number == number; });
}

void MxReportingConnection::send(Request request)
{
    std::uint32_t msgid = nextMsgid_++;
    auto bytes = std::make_shared<msgpack::sbuffer>();
    encodeRpcRequest(*bytes, msgid, request.method, request.params);
    if (request.oneWay) {
        outbox_.push_back({std::move(bytes), std::move(request.done)});
    } else {
        outbox_.push_back({std::move(bytes), nullptr});
        inFlight_.emplace(msgid, std::move(request));
    }
    writeMore();
}

void MxReportingConnection::readMore()
{
    auto space = decoder_->buffer();
    socket_.async_read_some(asio::buffer(space.data(), space.size()),
                            [this, generation = generation_](const std::error_code& error, std::size_t bytes) {
                                // A read of a connection already lost belongs to nobody.
                                if (closing_ || generation != generation_)
                                    return;
                                if (error) {
                                    lose(error == asio::error::eof ? "the daemon closed it" : error.message());
                                    return;
                                }
                                decoder_->consumed(bytes);
                                Value message;
                                std::string reason;
                                for (;;) {
                                    auto status = decoder_->next(message, reason);
                                    if (status == MsgpackRpcDecoder::Status::NeedMore)
                                        break;
                                    if (status == MsgpackRpcDecoder::Status::Bad) {
                                        // What was in flight may have been answered in
                                        // what could not be read: not sent again.
                                        failInFlight(-EPROTO);
                                        lose("unreadable reply: " + reason);
                                        return;
                                    }
                                    deliver(message);
                                }
                                readMore();
                            });
}

void MxReportingConnection::deliver(const Value& message)
{
    std::string reason;
    auto response = parseRpcResponse(message, reason);
    if (!response)
        return;
    answered_ = true;
    // A second reply to one request (the daemon answers one query twice) finds none.
    auto found = inFlight_.find(response->msgid);
    if (found == inFlight_.end())
        return;
    Completion done = std::move(found->second.done);
    inFlight_.erase(found);
    if (!done)
        return;
    if (response->error.isNil())
        done(0, response->result);
    else
        done(errorOf(response->error), response->error);
}

// The connection layer's refusals: a limit of the daemon's names itself in the
// message its error carries, and each has an errno of its own.
int MxReportingConnection::errorOf(const Value& error)
{
    const Dictionary* fields = error.asDictionary();
    const Value* code = fields ? fields->find("code") : nullptr;
    const Value* message = fields ? fields->find("message") : nullptr;
    if (!code || code->int64Value() != kDaemonLimitCode || !message || !message->asString())
        return -EINVAL;
    const std::string& text = *message->asString();
    if (text.starts_with("too many sessions"))
        return -EMFILE;
    if (text.starts_with("too many reporter IDs"))
        return -E2BIG;
    if (text.starts_with("the session keeps too much"))
        return -ENOSPC;
    return -EINVAL;
}

void MxReportingConnection::writeMore()
{
    if (writing_ || outbox_.empty() || !connected_)
        return;
    writing_ = true;
    std::vector<asio::const_buffer> buffers;
    buffers.reserve(outbox_.size());
    for (const auto& outgoing : outbox_)
        buffers.emplace_back(outgoing.bytes->data(), outgoing.bytes->size());
    asio::async_write(
        socket_, buffers,
        [this, batch = outbox_.size(), generation = generation_](const std::error_code& error, std::size_t) {
            if (closing_ || generation != generation_)
                return;
            writing_ = false;
            if (error) {
                lose(error.message());
                return;
            }
            std::vector<Completion> written;
            for (std::size_t i = 0; i < batch; ++i) {
                if (outbox_.front().written)
                    written.push_back(std::move(outbox_.front().written));
                outbox_.pop_front();
            }
            for (auto& done : written)
                done(0, Value());
            writeMore();
        });
}

// What was in flight waits again, in the order it was made, for a new connection; a
// start is not sent again: restoring its session starts it.
void MxReportingConnection::lose(const std::string& why)
{
    if (!connected_)
        return;
    connected_ = false;
    ++generation_;
    writing_ = false;
    // A one-way request not yet written is not sent again: it was for that daemon.
    std::vector<Completion> unwritten;
    for (auto& outgoing : outbox_)
        if (outgoing.written)
            unwritten.push_back(std::move(outgoing.written));
    outbox_.clear();
    for (auto& done : unwritten)
        done(-ENOTCONN, Value());
    std::error_code ignored;
    socket_.close(ignored);
    socket_ = asio::local::stream_protocol::socket(io_);
    decoder_ = std::make_unique<MsgpackRpcDecoder>();
    std::vector<Request> again;
    for (auto& [msgid, request] : inFlight_)
        if (!request.held)
            again.push_back(std::move(request));
    inFlight_.clear();
    std::sort(again.begin(), again.end(), [](const Request& a, const Request& b) { return a.number < b.number; });
    unsent_.insert(unsent_.begin(), std::make_move_iterator(again.begin()), std::make_move_iterator(again.end()));
    // A connection that breaks as soon as it is made, before any reply (a peer that
    // answers garbage or closes at once), is retried ever more slowly, and said once.
    if (answered_ || Clock::now() - connectedAt_ >= kHealthy) {
        backoff_ = kFirstReconnect;
        quietReconnects_ = false;
        log_(LOG_WARNING, "connection to " + socketPath_.string() + " lost (" + why + "): reconnecting");
    } else if (!quietReconnects_) {
        quietReconnects_ = true;
        log_(LOG_WARNING,
             "connection to " + socketPath_.string() + " broke at once (" + why + "): reconnecting at most every " +
                 std::to_string(kLongestReconnect.count() / 1000) + " s, without a line each time");
    }
    reconnectLater();
}

void MxReportingConnection::reconnectLater()
{
    reconnectTimer_.expires_after(backoff_);
    backoff_ = std::min(backoff_ * 2, kLongestReconnect);
    reconnectTimer_.async_wait([this](const std::error_code& cancelled) {
        if (!cancelled && !closing_)
            reconnect();
    });
}

void MxReportingConnection::reconnect()
{
    failExpired();
    socket_.async_connect(asio::local::stream_protocol::endpoint(socketPath_.string()),
                          [this](const std::error_code& error) {
                              if (closing_)
                                  return;
                              if (error) {
                                  socket_ = asio::local::stream_protocol::socket(io_);
                                  reconnectLater();
                                  return;
                              }
                              connected_ = true;
                              connectedAt_ = Clock::now();
                              answered_ = false;
                              restore();
                              readMore();
                              resumeRing();
                          });
}

// The sessions first, as they were; then what waited, in order.
void MxReportingConnection::restore()
{
    auto restoration = registry_.restoration();
    for (auto& [method, params] : restoration) {
        bool held = method == method::kStartReportingSessionForID;
        send(Request{++requests_, std::string(method), std::move(params), nullptr, Clock::now(), held});
    }
    std::size_t resent = unsent_.size();
    while (!unsent_.empty()) {
        Request request = std::move(unsent_.front());
        unsent_.pop_front();
        send(std::move(request));
    }
    if (!quietReconnects_)
        log_(LOG_NOTICE,
             "reconnected to " + socketPath_.string() + ": " + std::to_string(registry_.size()) +
                 " sessions restored, " + std::to_string(resent) + " requests sent again");
}

void MxReportingConnection::failExpired()
{
    auto now = Clock::now();
    std::vector<Request> expired;
    for (auto request = unsent_.begin(); request != unsent_.end();) {
        if (request->deadline > now) {
            ++request;
            continue;
        }
        expired.push_back(std::move(*request));
        request = unsent_.erase(request);
    }
    for (auto& request : expired)
        if (request.done)
            request.done(-ENOTCONN, Value());
}

void MxReportingConnection::failInFlight(int error)
{
    std::vector<Completion> failed;
    for (auto& [msgid, request] : inFlight_)
        if (!request.held && request.done)
            failed.push_back(std::move(request.done));
    std::erase_if(inFlight_, [](const auto& entry) { return !entry.second.held; });
    for (auto& done : failed)
        done(error, Value());
}

// Reports are taken from the ring only while there is a connection to send them on,
// and only so many at a time: the rest wait in the ring, which drops when full.
std::size_t MxReportingConnection::realtimeRoom() const
{
    return connected_ ? kRealtimeOutstanding - std::min(kRealtimeOutstanding, realtimeOutstanding_) : 0;
}

void MxReportingConnection::watchRing()
{
    for (;;) {
        ring_->drain(realtimeRoom(), [this](const MxReportingRealtimeRing::Report& report) { takeRealtime(report); });
        if (realtimeRoom() == 0) {
            ringPaused_ = true; // resumeRing() takes it up again
            return;
        }
        if (ring_->prepareToWait())
            break;
    }
    wake_.async_wait(asio::posix::stream_descriptor::wait_read, [this](const std::error_code& error) {
        if (error || closing_)
            return;
        ring_->acknowledgeWake();
        watchRing();
    });
}

void MxReportingConnection::resumeRing()
{
    if (!ringPaused_ || closing_ || realtimeRoom() == 0)
        return;
    ringPaused_ = false;
    watchRing();
}

void MxReportingConnection::takeRealtime(const MxReportingRealtimeRing::Report& report)
{
    std::string reason;
    msgpack::object_handle handle =
        msgpack::unpack(reinterpret_cast<const char*>(report.payload.data()), report.payload.size());
    auto payload = decodeMsgpack(handle.get(), reason);
    if (!payload) {
        ++realtimeFailed_;
        return;
    }
    Value ids = report.reporterID != 0 ? Value(Array{report.reporterID}) : Value();
    ++realtimeOutstanding_;
    Request request{++requests_, std::string(method::kSendMessage),
                    Array{std::move(*payload), report.category, report.type, std::move(ids)},
                    [this](int error, const Value& result) {
                        --realtimeOutstanding_;
                        if (error == 0 && result.isNil())
                            ++realtimeSent_;
                        else
                            ++realtimeFailed_;
                        resumeRing();
                    },
                    Clock::now() + timeout()};
    submit(std::move(request), {});
}

// What still waits is answered: not sent, and never to be.
void MxReportingConnection::close()
{
    closing_ = true;
    reconnectTimer_.cancel();
    std::error_code ignored;
    wake_.cancel(ignored);
    socket_.close(ignored);
    std::vector<Completion> waiting;
    for (auto& request : unsent_)
        if (request.done)
            waiting.push_back(std::move(request.done));
    for (auto& [msgid, request] : inFlight_)
        if (request.done)
            waiting.push_back(std::move(request.done));
    for (auto& outgoing : outbox_)
        if (outgoing.written)
            waiting.push_back(std::move(outgoing.written));
    outbox_.clear();
    unsent_.clear();
    inFlight_.clear();
    for (auto& done : waiting)
        done(-ENOTCONN, Value());
}

} // namespace mx
