#include "client/MxReportingClient.h"

#include <deque>
#include <future>
#include <map>
#include <thread>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/post.hpp>
#include <asio/write.hpp>

#include "wire/MsgpackRpcDecoder.h"
#include "wire/MsgpackRpcMessage.h"
#include "wire/MxReportingMethods.h"
#include "wire/RootPath.h"

namespace mx {

// The socket and everything in flight on it, owned by the client's I/O thread.
// Handlers capture the connection bare: the destructor joins the thread, so none
// outlives it, and none may own it (the last owner would then join its own thread).
class MxReportingClient::Connection {
public:
    Connection() : keepRunning_(io_.get_executor()), socket_(io_) {}

    ~Connection()
    {
        keepRunning_.reset();
        asio::post(io_, [this] {
            std::error_code ignored;
            socket_.close(ignored);
        });
        if (thread_.joinable())
            thread_.join();
    }

    bool open(const std::filesystem::path& path, std::string& error)
    {
        std::error_code failure;
        socket_.connect(asio::local::stream_protocol::endpoint(path.string()), failure);
        if (failure) {
            error = "cannot connect to " + path.string() + ": " + failure.message();
            return false;
        }
        readMore();
        thread_ = std::thread([this] { io_.run(); });
        return true;
    }

    void send(std::string_view method, const Array& params, Callback<Value> done)
    {
        auto bytes = std::make_shared<msgpack::sbuffer>();
        std::uint32_t msgid = nextMsgid_.fetch_add(1);
        encodeRpcRequest(*bytes, msgid, method, params);
        asio::post(io_, [self = this, msgid, bytes = std::move(bytes), done = std::move(done)]() mutable {
            if (self->closed_) {
                if (done)
                    done({std::nullopt, MxClientError{MxClientError::Kind::Disconnected, 0, "connection closed"}});
                return;
            }
            if (done)
                self->pending_.emplace(msgid, std::move(done));
            self->outbox_.push_back(std::move(bytes));
            self->writeMore();
        });
    }

private:
    void readMore()
    {
        auto space = decoder_.buffer();
        socket_.async_read_some(asio::buffer(space.data(), space.size()),
                                [this](const std::error_code& error, std::size_t bytes) {
                                    if (error) {
                                        closeAll("connection closed by the daemon");
                                        return;
                                    }
                                    decoder_.consumed(bytes);
                                    Value message;
                                    std::string reason;
                                    for (;;) {
                                        auto status = decoder_.next(message, reason);
                                        if (status == MsgpackRpcDecoder::Status::NeedMore)
                                            break;
                                        if (status == MsgpackRpcDecoder::Status::Bad) {
                                            closeAll("unreadable reply: " + reason);
                                            return;
                                        }
                                        deliver(message);
                                    }
                                    readMore();
                                });
    }

    void deliver(const Value& message)
    {
        std::string reason;
        auto response = parseRpcResponse(message, reason);
        if (!response)
            return;
        auto found = pending_.find(response->msgid);
        if (found == pending_.end())
            return;
        auto done = std::move(found->second);
        pending_.erase(found);
        if (response->error.isNil()) {
            done({response->result, std::nullopt});
            return;
        }
        MxClientError error{MxClientError::Kind::Rpc, 0, response->error.description()};
        if (const Dictionary* details = response->error.asDictionary()) {
            if (const Value* code = details->find("code"))
                error.code = code->int64Value();
            if (const Value* text = details->find("message"); text && text->asString())
                error.message = *text->asString();
        }
        done({std::nullopt, error});
    }

    void writeMore()
    {
        if (writing_ || outbox_.empty())
            return;
        writing_ = true;
        std::vector<asio::const_buffer> buffers;
        for (const auto& bytes : outbox_)
            buffers.emplace_back(bytes->data(), bytes->size());
        std::size_t batch = outbox_.size();
        asio::async_write(socket_, buffers, [this, batch](const std::error_code& error, std::size_t) {
            writing_ = false;
            if (error) {
                closeAll("cannot write to the daemon: " + error.message());
                return;
            }
            outbox_.erase(outbox_.begin(), outbox_.begin() + static_cast<std::ptrdiff_t>(batch));
            writeMore();
        });
    }

    void closeAll(const std::string& why)
    {
        closed_ = true;
        std::error_code ignored;
        socket_.close(ignored);
        outbox_.clear();
        auto pending = std::move(pending_);
        pending_.clear();
        for (auto& [msgid, done] : pending)
            done({std::nullopt, MxClientError{MxClientError::Kind::Disconnected, 0, why}});
    }

    asio::io_context io_;
    asio::executor_work_guard<asio::io_context::executor_type> keepRunning_;
    asio::local::stream_protocol::socket socket_;
    MsgpackRpcDecoder decoder_;
    std::map<std::uint32_t, Callback<Value>> pending_;
    std::deque<std::shared_ptr<msgpack::sbuffer>> outbox_;
    bool writing_ = false;
    bool closed_ = false;
    std::atomic<std::uint32_t> nextMsgid_{1};
    std::thread thread_;
};

namespace {

template <class T>
using Convert = std::function<std::optional<T>(const Value&)>;

template <class T>
MxReportingClient::Callback<Value> adapt(MxReportingClient::Callback<T> done, Convert<T> convert)
{
    return [done = std::move(done), convert = std::move(convert)](MxClientResult<Value> result) {
        if (!done)
            return;
        if (!result.value) {
            done({std::nullopt, result.error});
            return;
        }
        auto converted = convert(*result.value);
        if (!converted) {
            done({std::nullopt,
                  MxClientError{MxClientError::Kind::Protocol, 0, "unexpected reply " + result.value->description()}});
            return;
        }
        done({std::move(converted), std::nullopt});
    };
}

std::optional<bool> toBool(const Value& value)
{
    return value.asBool() ? std::optional<bool>(*value.asBool()) : std::nullopt;
}

std::optional<ServiceType> toServiceType(const Value& value)
{
    if (!value.isNumber() || value.int64Value() < 0 || value.int64Value() > 0xFFFF)
        return std::nullopt;
    return static_cast<ServiceType>(value.int64Value());
}

std::optional<Dictionary> toDictionary(const Value& value)
{
    return value.asDictionary() ? std::optional<Dictionary>(*value.asDictionary()) : std::nullopt;
}

std::optional<std::vector<ReporterID>> toReporters(const Value& value)
{
    const Array* array = value.asArray();
    if (!array)
        return std::nullopt;
    std::vector<ReporterID> reporters;
    for (const auto& item : *array)
        reporters.push_back(item.int64Value());
    return reporters;
}

std::optional<MxSendOutcome> toSendOutcome(const Value& value)
{
    if (value.isNil())
        return MxSendOutcome{};
    const Dictionary* refusal = value.asDictionary();
    if (!refusal)
        return std::nullopt;
    const Value* domain = refusal->find("domain");
    const Value* code = refusal->find("code");
    return MxSendOutcome{
        MxSendRefusal{domain && domain->asString() ? *domain->asString() : "", code ? code->int64Value() : 0}};
}

Value reporterIDs(const std::optional<std::vector<ReporterID>>& ids)
{
    if (!ids)
        return Value();
    return Array(std::vector<Value>(ids->begin(), ids->end()));
}

Value optionalDictionary(const std::optional<Dictionary>& dictionary)
{
    return dictionary ? Value(*dictionary) : Value();
}

} // namespace

std::filesystem::path MxReportingClient::defaultSocketPath() { return MxReportingPath("run/harmonia/reporting.sock"); }

std::unique_ptr<MxReportingClient> MxReportingClient::connect(const std::filesystem::path& socket, std::string& error)
{
    auto connection = std::make_unique<Connection>();
    if (!connection->open(socket, error))
        return nullptr;
    return std::unique_ptr<MxReportingClient>(new MxReportingClient(std::move(connection)));
}

MxReportingClient::MxReportingClient(std::unique_ptr<Connection> connection) : connection_(std::move(connection)) {}

MxReportingClient::~MxReportingClient() = default;

void MxReportingClient::call(std::string_view method, const Array& params, Callback<Value> done)
{
    connection_->send(method, params, std::move(done));
}

void MxReportingClient::createReportingSession(ReporterID reporterID, Callback<bool> done)
{
    call(method::kCreateReportingSession, Array{reporterID}, adapt<bool>(std::move(done), toBool));
}

void MxReportingClient::setServiceType(ServiceType serviceType, ReporterID reporterID, Callback<bool> done)
{
    call(method::kSetServiceType, Array{serviceType, reporterID}, adapt<bool>(std::move(done), toBool));
}

void MxReportingClient::getServiceNameForReporterID(ReporterID reporterID, Callback<ServiceType> done)
{
    call(method::kGetServiceNameForReporterID, Array{reporterID}, adapt<ServiceType>(std::move(done), toServiceType));
}

void MxReportingClient::setConfiguration(const std::optional<Dictionary>& configuration, ReporterID reporterID,
                                         Callback<bool> done)
{
    call(method::kSetConfiguration, Array{optionalDictionary(configuration), reporterID},
         adapt<bool>(std::move(done), toBool));
}

void MxReportingClient::startReportingSessionForID(ReporterID reporterID, Callback<bool> done)
{
    call(method::kStartReportingSessionForID, Array{reporterID}, adapt<bool>(std::move(done), toBool));
}

void MxReportingClient::sendMessage(const Dictionary& payload, MessageCategory category, MessageType type,
                                    const std::optional<std::vector<ReporterID>>& reportingIDs,
                                    Callback<MxSendOutcome> done)
{
    call(method::kSendMessage, Array{payload, category, type, reporterIDs(reportingIDs)},
         adapt<MxSendOutcome>(std::move(done), toSendOutcome));
}

void MxReportingClient::stopReportingSessionForID(ReporterID reporterID, Callback<bool> done)
{
    call(method::kStopReportingSessionForID, Array{reporterID}, adapt<bool>(std::move(done), toBool));
}

void MxReportingClient::destroyReportingSession(ReporterID reporterID, Callback<bool> done)
{
    call(method::kDestroyReportingSession, Array{reporterID}, adapt<bool>(std::move(done), toBool));
}

void MxReportingClient::reporterID(ReporterID reporterID, Callback<Dictionary> valid)
{
    call(method::kReporterIDValid, Array{reporterID}, adapt<Dictionary>(std::move(valid), toDictionary));
}

void MxReportingClient::getAllReporters(Callback<std::vector<ReporterID>> done)
{
    call(method::kGetAllReporters, Array{}, adapt<std::vector<ReporterID>>(std::move(done), toReporters));
}

void MxReportingClient::killService() { call(method::kKillService, Array{}, nullptr); }

template <class T>
MxClientResult<T> MxReportingClient::wait(const std::function<void(Callback<T>)>& start)
{
    auto reply = std::make_shared<std::promise<MxClientResult<T>>>();
    start([reply](MxClientResult<T> result) { reply->set_value(std::move(result)); });
    auto future = reply->get_future();
    if (future.wait_for(timeout_) != std::future_status::ready)
        return {std::nullopt, MxClientError{MxClientError::Kind::Timeout, 0, "no reply in time"}};
    return future.get();
}

MxClientResult<Value> MxReportingClient::call(std::string_view method, const Array& params)
{
    return wait<Value>([&](Callback<Value> done) { call(method, params, std::move(done)); });
}

MxClientResult<bool> MxReportingClient::createReportingSession(ReporterID reporterID)
{
    return wait<bool>([&](Callback<bool> done) { createReportingSession(reporterID, std::move(done)); });
}

MxClientResult<bool> MxReportingClient::setServiceType(ServiceType serviceType, ReporterID reporterID)
{
    return wait<bool>([&](Callback<bool> done) { setServiceType(serviceType, reporterID, std::move(done)); });
}

MxClientResult<ServiceType> MxReportingClient::getServiceNameForReporterID(ReporterID reporterID)
{
    return wait<ServiceType>(
        [&](Callback<ServiceType> done) { getServiceNameForReporterID(reporterID, std::move(done)); });
}

MxClientResult<bool> MxReportingClient::setConfiguration(const std::optional<Dictionary>& configuration,
                                                         ReporterID reporterID)
{
    return wait<bool>([&](Callback<bool> done) { setConfiguration(configuration, reporterID, std::move(done)); });
}

MxClientResult<bool> MxReportingClient::stopReportingSessionForID(ReporterID reporterID)
{
    return wait<bool>([&](Callback<bool> done) { stopReportingSessionForID(reporterID, std::move(done)); });
}

MxClientResult<bool> MxReportingClient::destroyReportingSession(ReporterID reporterID)
{
    return wait<bool>([&](Callback<bool> done) { destroyReportingSession(reporterID, std::move(done)); });
}

MxClientResult<MxSendOutcome> MxReportingClient::sendMessage(const Dictionary& payload, MessageCategory category,
                                                             MessageType type,
                                                             const std::optional<std::vector<ReporterID>>& reportingIDs)
{
    return wait<MxSendOutcome>(
        [&](Callback<MxSendOutcome> done) { sendMessage(payload, category, type, reportingIDs, std::move(done)); });
}

MxClientResult<Dictionary> MxReportingClient::reporterID(ReporterID reporterID)
{
    return wait<Dictionary>([&](Callback<Dictionary> done) { this->reporterID(reporterID, std::move(done)); });
}

MxClientResult<std::vector<ReporterID>> MxReportingClient::getAllReporters()
{
    return wait<std::vector<ReporterID>>(
        [&](Callback<std::vector<ReporterID>> done) { getAllReporters(std::move(done)); });
}

} // namespace mx
