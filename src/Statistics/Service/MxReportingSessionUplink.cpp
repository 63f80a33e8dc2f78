#include "Statistics/Service/MxReportingSessionUplink.h"

#include <cassert>
#include <random>
#include <utility>

#include "Statistics/MxReportingUtilityWait.h"
#include "Statistics/Service/MxReportingSession.h"
#include "platform/BacklogAccount.h"
#include "platform/MxLog.h"
#include "platform/ReplyGate.h"
#include "platform/TracePoints.h"

namespace mx {

namespace {

constexpr std::uint32_t kTraceMessageQueued = 0x21042838;

constexpr std::int64_t kUplinkClientType = 19;
// The backend reads the client version as the single-precision value of "2.0".
constexpr float kUplinkClientVersion = 2.0f;
constexpr float kDiscoveryTimeoutSeconds = 9.0f;
constexpr const char* kUplinkClientName = "com.kestrel.harmonia";

const MxLogScope* logScope() { return MxReportingSession::logScope(); }

std::int64_t randomAlarmDelaySeconds()
{
    thread_local std::mt19937_64 generator{std::random_device{}()};
    return std::uniform_int_distribution<std::int64_t>(0, 59)(generator);
}

} // namespace

MxReportingSessionUplink::MxReportingSessionUplink(ReporterID reporterID)
    : reporterID_(reporterID),
      queue_(
          ProcessWide<Dispatch>::get().makeSerialQueue("com.kestrel.harmonia.session.uplink", QueuePriority::Utility))
{
}

void MxReportingSessionUplink::runLater(Job job)
{
    {
        std::lock_guard lock(jobsMutex_);
        if (busy_) {
            waiting_.push_back(std::move(job));
            return;
        }
        busy_ = true;
    }
    if (job() == JobEnd::Done)
        runWaiting();
}

void MxReportingSessionUplink::runOnQueue(Job job, std::shared_ptr<void> owner)
{
    {
        std::lock_guard lock(jobsMutex_);
        if (busy_) {
            waiting_.push_back(std::move(job));
            return;
        }
        busy_ = true;
    }
    queue_->dispatch([this, job = std::move(job), owner = std::move(owner)]() mutable {
        if (job() == JobEnd::Done)
            runWaiting();
    });
}

void MxReportingSessionUplink::runWaiting()
{
    for (;;) {
        Job next;
        {
            std::lock_guard lock(jobsMutex_);
            if (waiting_.empty()) {
                busy_ = false;
                return;
            }
            next = std::move(waiting_.front());
            waiting_.pop_front();
        }
        if (next() == JobEnd::Suspended)
            return;
    }
}

MxReportingSessionUplink::JobEnd MxReportingSessionUplink::configure(ServiceType currentType,
                                                                     const Configuration& configuration,
                                                                     std::shared_ptr<void> owner)
{
    if (currentType == service_type::kTest)
        return JobEnd::Done;

    auto& uplink = ProcessWide<Uplink>::get();
    auto token = uplink.newSecureHierarchyToken(nullptr);
    uplinkAgentToken_.set(token);

    bool realtime = configuration.serviceType == service_type::kAPIUsage;
    Dictionary sessionInfo{
        {kUplinkSessionInfoClientType, kUplinkClientType}, {kUplinkSessionInfoClientVersion, kUplinkClientVersion},
        {kUplinkSessionInfoSessionID, reporterID_},        {kUplinkSessionInfoBatchEvent, !realtime},
        {kUplinkSessionInfoHierarchyToken, token.text()},  {kUplinkSessionInfoContainsRealtimeEvents, realtime},
    };
    Dictionary backendUserInfo{
        {kUplinkUserInfoClientName, kUplinkClientName},
        {kUplinkUserInfoServiceName, configuration.serviceName + "_session"},
    };
    backendUserInfo.merge(configuration.userInfo->snapshot());

    auto session = uplink.makeSession(std::move(sessionInfo), std::move(backendUserInfo), {});
    uplinkSession_.set(session);
    auto discovery = std::make_shared<MxReportingQueueCondition>(configuration.discovered);
    session->startConfiguration([discovery](std::optional<std::vector<std::string>> backends) {
        if (!backends) {
            // Intended: the waiter is not woken and runs into its timeout.
            MXLOG(logScope(), Error, "No backends found, this session won't get sent to the server");
            return;
        }
        MXLOG(logScope(), Default, "List of backends {}",
              Value(Array(std::vector<Value>(backends->begin(), backends->end()))).description());
        discovery->signal();
    });

    // Whichever of the wait's end and this job's return comes second goes on: in
    // place when the wait ended at once, else the wait's end resumes the queue.
    enum : int { kWaiting, kEnded, kReturned };
    auto handOff = std::make_shared<std::atomic<int>>(kWaiting);
    MxReportingUtilityWait(discovery, "waiting for uplinkd to find backends", "failed to find backend", logScope(),
                           double(kDiscoveryTimeoutSeconds), queue_,
                           [this, handOff, owner = std::move(owner)](bool found) {
                               // Intended: success leaves uplinkSessionStarted false, so
                               // every start waits for discovery afresh.
                               if (!found) {
                                   uplinkSession_.set(nullptr);
                                   uplinkSessionStarted_.store(false);
                               }
                               if (handOff->exchange(kEnded) == kReturned)
                                   resume();
                           });
    return handOff->exchange(kReturned) == kEnded ? JobEnd::Done : JobEnd::Suspended;
}

void MxReportingSessionUplink::deliver(ServiceType currentType, const Delivery& delivery,
                                       const MxLockedDictionary& userInfo)
{
    if (!delivery.wasStarted) {
        MXLOG_VERBOSE(logScope(), "session not started, will send as a single message");
        Dictionary snapshot = userInfo.snapshot();
        sendSingleMessage(delivery.cleaned, delivery.category, delivery.type, currentType, &snapshot, nullptr);
        return;
    }
    if (currentType == service_type::kTest) {
        MXLOG(logScope(), Info, "transactions aren't allowed on this platform");
        return;
    }
    auto session = uplinkSession();
    if (!session) {
        UplinkError error{-1, "No valid UplinkSession"};
        MXLOG(logScope(), Error, "{}", error.description);
        return;
    }
    // Intended: a refused send is silent; the backend's error is not logged.
    std::optional<UplinkError> error;
    if (session->sendMessage(static_cast<std::uint16_t>(delivery.category & 0xFFFF), delivery.type, delivery.cleaned,
                             error))
        MXLOG_VERBOSE(logScope(), "UplinkAgent {} : message {} : category {} : type {}", session->description(),
                      Value(delivery.message).description(), static_cast<std::int32_t>(delivery.category),
                      delivery.type);
}

void MxReportingSessionUplink::flush(ServiceType currentType)
{
    if (currentType == service_type::kTest)
        return;
    if (auto session = uplinkSession())
        session->flushMessages([](std::optional<UplinkError> error) {
            if (error)
                MXLOG(logScope(), Error, "flush error {}", error->description);
        });
    // The token stays until the next start replaces it.
    uplinkSession_.set(nullptr);
}

void MxReportingSessionUplink::sendSingleMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                                 ServiceType serviceType, const Dictionary* /*userInfo*/,
                                                 SendReply reply)
{
    std::int64_t delta = serviceType == service_type::kAlarms ? randomAlarmDelaySeconds() : 0;
    MXLOG_VERBOSE(logScope(), "sending single message after delta {} for service {}", delta, serviceType);

    // Owed by the client that sent it while it waits, up to 59 s for an alarm; and,
    // unless it waits out an alarm's delay (which a process that ends loses, as
    // intended), its request's reply waits for it.
    auto send = [message, category, type, serviceType, reply = std::move(reply), debt = BacklogDebt::incur(),
                 ticket = delta == 0 ? ReplyTicket::take() : ReplyTicket()]() mutable {
        ScopedBacklogAccount charging(debt);
        ScopedReplyGate replying(ticket);
        MxTrace(kTraceMessageQueued);
        MXLOG_VERBOSE(logScope(), "sending single message");
        Dictionary sessionInfo{
            {kUplinkSessionInfoClientType, kUplinkClientType},
            {kUplinkSessionInfoClientVersion, kUplinkClientVersion},
            {kUplinkSessionInfoSessionID, -1},
        };
        Dictionary userInfo{
            {kUplinkUserInfoClientName, kUplinkClientName},
            {kUplinkUserInfoServiceName, MxReportingServiceTypeName(serviceType)},
        };
        std::optional<UplinkError> error;
        bool sent = ProcessWide<Uplink>::get().sendOneMessage(std::move(sessionInfo), std::move(userInfo),
                                                              static_cast<std::uint16_t>(category & 0xFFFF), type,
                                                              MxReportingCleanKeys(message), error);
        if (!sent && error)
            MXLOG(logScope(), Error, "sendOneMessageWithSessionInfo {}", error->description);
        if (sent)
            MXLOG_VERBOSE(logScope(), "message {} : category {} : type {}", Value(message).description(),
                          static_cast<std::int32_t>(category), type);
        if (reply)
            reply(sent ? std::nullopt : error);
        ticket.giveBack();
    };

    auto& queue = ProcessWide<Dispatch>::get().globalQueue(QueuePriority::Utility);
    if (delta == 0)
        queue.dispatch(std::move(send));
    else
        queue.dispatchAfter(std::chrono::seconds(delta), std::move(send));
}

} // namespace mx
