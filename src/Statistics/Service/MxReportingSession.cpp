#include "Statistics/Service/MxReportingSession.h"

#include <random>

#include <fmt/format.h>

#include "Statistics/MxReportingUtilityWait.h"
#include "platform/FileSystem.h"
#include "platform/JsonValue.h"
#include "platform/TracePoints.h"

namespace mx {

namespace {

constexpr std::uint32_t kTraceSessionCreated = 0x21042828;
constexpr std::uint32_t kTraceSessionStarted = 0x2104282C;
constexpr std::uint32_t kTraceSessionStopping = 0x21042830;
constexpr std::uint32_t kTraceSessionDestroyed = 0x21042834;
constexpr std::uint32_t kTraceMessageQueued = 0x21042838;

constexpr std::int64_t kUplinkClientType = 19;
// The backend reads the client version as the single-precision value of "2.0".
constexpr float kUplinkClientVersion = 2.0f;
constexpr float kDiscoveryTimeoutSeconds = 9.0f;
constexpr const char* kUplinkClientName = "com.kestrel.harmonia";
constexpr const char* kSummaryDirectory = "/private/var/mobile/Library/Logs/FaultDesk/DiagnosticLogs/Audio/Reporting";

// Most payloads carry no spaced key; they are shared as they are, not rebuilt.
bool hasSpacedKey(const Dictionary& message)
{
    for (const auto& [key, value] : message)
        if (key.find(' ') != std::string::npos)
            return true;
    return false;
}

std::int64_t randomAlarmDelaySeconds()
{
    thread_local std::mt19937_64 generator{std::random_device{}()};
    return std::uniform_int_distribution<std::int64_t>(0, 59)(generator);
}

} // namespace

// The backend-list callback and the configuration job meet here: the flag says that
// backends were found, and is read and written only under the condition's lock.
struct MxReportingDiscovery {
    explicit MxReportingDiscovery(bool found) : found(found) {}
    MxReportingCondition condition;
    bool found;
};

Dictionary MxReportingCleanKeys(const Dictionary& message)
{
    if (!hasSpacedKey(message))
        return message;
    Dictionary cleaned;
    for (const auto& [key, value] : message) {
        std::string cleanedKey = key;
        for (char& c : cleanedKey)
            if (c == ' ')
                c = '_';
        cleaned.set(std::move(cleanedKey), value);
    }
    return cleaned;
}

const MxLogScope* MxReportingSession::logScope()
{
    static const MxLogScope* scope = MxLogRegisterScope(1, MxFourCharCode("mxrr"), "mxrr", "com.kestrel.harmonia",
                                                        "reporting_session_verbose", 31);
    return scope;
}

MxReportingSession::MxReportingSession(ReporterID reporterID, std::vector<std::int32_t> processIdentifiers)
    : reporterID_(reporterID),
      processIdentifiers_(std::move(processIdentifiers)),
      aggregatedPayloadData_(std::make_shared<MxReportingAggregationArray>()),
      nestedAggregatedPayloadData_(std::make_shared<MxReportingAggregationArray>()),
      uplinkQueue_(ProcessWide<Dispatch>::get().makeSerialQueue("com.kestrel.harmonia.session.uplink",
                                                                 QueuePriority::Utility))
{
    MXLOG(logScope(), Info, "created reporting session for ID: {}", reporterID_);
    MxTrace(kTraceSessionCreated);
}

MxReportingSession::~MxReportingSession()
{
    MxTrace(kTraceSessionDestroyed);
    MXLOG(logScope(), Info, "deallocing this session {}", reporterID_);
}

void MxReportingSession::setServiceType(ServiceType serviceType)
{
    serviceType_.store(serviceType, std::memory_order_relaxed);
    std::string name = MxReportingServiceTypeName(serviceType);
    MXLOG(logScope(), Info, "setting service type {}", name);
    serviceName_.set(std::move(name));
}

void MxReportingSession::setConfiguration(const std::optional<Dictionary>& configuration)
{
    if (configuration)
        userInfo_->merge(*configuration);
}

void MxReportingSession::updateDefaults(const std::optional<Dictionary>& defaults)
{
    if (defaults)
        userInfo_->merge(*defaults);
}

void MxReportingSession::start()
{
    MXLOG_VERBOSE(logScope(), "starting session owned by {}", reporterID_);
    if (started()) {
        MXLOG(logScope(), Info, "{} is already started", reporterID_);
        return;
    }
    setStarted(true);
    aggregatedPayloadData_.set(std::make_shared<MxReportingAggregationArray>());
    nestedAggregatedPayloadData_.set(std::make_shared<MxReportingAggregationArray>());
    MxTrace(kTraceSessionStarted);

    // The live user information is handed on, not a copy: configuration merged in
    // before the job runs still reaches the backend session.
    auto discovery = std::make_shared<MxReportingDiscovery>(uplinkSessionStarted());
    uplinkQueue_->dispatch([self = shared_from_this(), userInfo = userInfo_, serviceName = serviceName(),
                            serviceType = serviceType(), discovery] {
        self->configureUplink(userInfo, serviceName, serviceType, discovery);
    });
}

void MxReportingSession::configureUplink(const std::shared_ptr<MxLockedDictionary>& userInfo,
                                         const std::string& serviceName, ServiceType serviceType,
                                         const std::shared_ptr<MxReportingDiscovery>& discovery)
{
    if (this->serviceType() == service_type::kTest)
        return;

    auto& uplink = ProcessWide<Uplink>::get();
    auto token = uplink.newSecureHierarchyToken(nullptr);
    uplinkAgentToken_.set(token);

    bool realtime = serviceType == service_type::kAPIUsage;
    Dictionary sessionInfo{
        {kUplinkSessionInfoClientType, kUplinkClientType},
        {kUplinkSessionInfoClientVersion, kUplinkClientVersion},
        {kUplinkSessionInfoSessionID, reporterID_},
        {kUplinkSessionInfoBatchEvent, !realtime},
        {kUplinkSessionInfoHierarchyToken, token.text()},
        {kUplinkSessionInfoContainsRealtimeEvents, realtime},
    };
    Dictionary backendUserInfo{
        {kUplinkUserInfoClientName, kUplinkClientName},
        {kUplinkUserInfoServiceName, serviceName + "_session"},
    };
    backendUserInfo.merge(userInfo->snapshot());

    auto session = uplink.makeSession(std::move(sessionInfo), std::move(backendUserInfo), {});
    setUplinkSession(session);
    session->startConfiguration([discovery](std::optional<std::vector<std::string>> backends) {
        if (!backends) {
            // The waiter is deliberately left to run into its timeout.
            MXLOG(logScope(), Error, "No backends found, this session won't get sent to the server");
            return;
        }
        MXLOG(logScope(), Default, "List of backends {}", Value(Array(std::vector<Value>(backends->begin(), backends->end()))).description());
        std::lock_guard lock(discovery->condition.mutex);
        discovery->found = true;
        discovery->condition.condition.notify_all();
    });

    bool found = MxReportingUtilityWait(discovery->condition, &discovery->found, "waiting for uplinkd to find backends",
                                        "failed to find backend", logScope(), double(kDiscoveryTimeoutSeconds));
    if (!found) {
        setUplinkSession(nullptr);
        setUplinkSessionStarted(false);
    }
}

void MxReportingSession::stop()
{
    MXLOG_VERBOSE(logScope(), "ending session {}", reporterID_);
    if (!started())
        return;
    MXLOG_VERBOSE(logScope(), "ending session {}", reporterID_);
    MxTrace(kTraceSessionStopping);

    if (auto summary = createSummaryEventForSession()) {
        MXLOG(logScope(), Default, "sending summary event for reporter {}", reporterID_);
        sendMessage(*summary, message_category::kSummary, message_type::kSummary, true, nullptr);
    }
    writeSummaryJson();

    uplinkQueue_->dispatch([self = shared_from_this()] { self->flushUplink(); });

    dropAggregated(aggregatedPayloadData_);
    dropAggregated(nestedAggregatedPayloadData_);
    setStarted(false);
}

void MxReportingSession::flushUplink()
{
    if (serviceType() == service_type::kTest)
        return;
    if (auto session = uplinkSession())
        session->flushMessages([](std::optional<UplinkError> error) {
            if (error)
                MXLOG(logScope(), Error, "flush error {}", error->description);
        });
    setUplinkSession(nullptr);
}

std::string MxReportingSession::messageIdForCategory(MessageCategory category, MessageType type)
{
    std::string base = fmt::format("{}_{}", MxReportingCategoryName(category), MxReportingMessageTypeName(type));
    auto& count = messageTypeCounts_[base];
    ++count;
    return fmt::format("{}_{}", base, count);
}

void MxReportingSession::sendMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                     SendReply reply)
{
    sendMessage(message, category, type, false, std::move(reply));
}

void MxReportingSession::sendMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                     bool /*sync*/, SendReply reply)
{
    MXLOG_VERBOSE(logScope(), "sending message for session owned by {}", reporterID_);
    Dictionary cleaned = MxReportingCleanKeys(message);
    std::string identifier = messageIdForCategory(category, type);
    Dictionary nested;
    nested.set(std::move(identifier), cleaned);
    appendAggregated(aggregatedPayloadData_, cleaned);
    appendAggregated(nestedAggregatedPayloadData_, std::move(nested));
    MxTrace(kTraceMessageQueued);

    // Whether the message goes in-session or alone is decided now, not at delivery.
    bool wasStarted = started();
    uplinkQueue_->dispatch([self = shared_from_this(), cleaned, message, wasStarted, category, type] {
        self->deliver(cleaned, message, wasStarted, category, type);
    });
    if (reply)
        reply(std::nullopt);
}

void MxReportingSession::deliver(const Dictionary& cleaned, const Dictionary& message, bool wasStarted,
                                 MessageCategory category, MessageType type)
{
    if (!wasStarted) {
        MXLOG_VERBOSE(logScope(), "session not started, will send as a single message");
        Dictionary userInfo = userInfo_->snapshot();
        sendSingleMessage(cleaned, category, type, serviceType(), &userInfo, nullptr);
        return;
    }
    if (serviceType() == service_type::kTest) {
        MXLOG(logScope(), Info, "transactions aren't allowed on this platform");
        return;
    }
    auto session = uplinkSession();
    if (!session) {
        UplinkError error{-1, "No valid UplinkSession"};
        MXLOG(logScope(), Error, "{}", error.description);
        return;
    }
    // A refused send is silent: the backend's error is deliberately not logged.
    std::optional<UplinkError> error;
    if (session->sendMessage(static_cast<std::uint16_t>(category & 0xFFFF), type, cleaned, error))
        MXLOG_VERBOSE(logScope(), "UplinkAgent {} : message {} : category {} : type {}", session->description(),
                      Value(message).description(), static_cast<std::int32_t>(category), type);
}

void MxReportingSession::sendSingleMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                           ServiceType serviceType, const Dictionary* /*userInfo*/, SendReply reply)
{
    std::int64_t delta = serviceType == service_type::kAlarms ? randomAlarmDelaySeconds() : 0;
    MXLOG_VERBOSE(logScope(), "sending single message after delta {} for service {}", delta, serviceType);

    auto send = [message, category, type, serviceType, reply = std::move(reply)]() mutable {
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
    };

    auto& queue = ProcessWide<Dispatch>::get().globalQueue(QueuePriority::Utility);
    if (delta == 0)
        queue.dispatch(std::move(send));
    else
        queue.dispatchAfter(std::chrono::seconds(delta), std::move(send));
}

std::optional<Dictionary> MxReportingSession::createSummaryEventForSession()
{
    auto array = aggregatedPayloadData();
    if (!array)
        return std::nullopt;
    std::lock_guard lock(array->monitor());
    if (array->items().empty())
        return std::nullopt;

    // Keys keep the order of their first appearance; values keep message order.
    std::vector<std::pair<std::string, std::string>> collected;
    std::map<std::string, std::size_t, std::less<>> position;
    auto collect = [&](const std::string& key, const std::string& text) {
        auto [found, inserted] = position.try_emplace(key, collected.size());
        if (inserted) {
            collected.emplace_back(key, text);
            return;
        }
        auto& joined = collected[found->second].second;
        joined += ',';
        joined += text;
    };
    collect("Mx_Session_Summary_Event", std::to_string(serviceType()));
    for (const auto& payload : array->items())
        if (const Dictionary* entries = payload.asDictionary())
            for (const auto& [key, value] : *entries)
                collect(key, value.description());

    Dictionary summary;
    for (auto& [key, joined] : collected)
        summary.set(key, std::move(joined));
    return summary;
}

std::string MxReportingSession::summaryFileName(std::time_t now) const
{
    std::tm local{};
    localtime_r(&now, &local);
    char date[32];
    std::strftime(date, sizeof(date), "%Y%m%d-%H%M%S%z", &local);

    std::string host = "unknown";
    if (auto stored = userInfo_->find("HostApplicationDisplayID"))
        host = stored->description();
    // The host is the client's text: it must not name another directory, nor make the
    // name longer than a file name may be.
    for (char& c : host)
        if (c == '/' || c == '\0')
            c = '_';
    if (host.size() > 128)
        host.resize(128);
    return fmt::format("{}-{}-{}-{}.json", date, "harmonia", host, MxReportingServiceTypeName(serviceType()));
}

void MxReportingSession::writeSummaryJson()
{
    if (!MxReportingInternalBuild())
        return;
    auto nested = nestedAggregatedPayloadData();
    if (!nested)
        return;
    std::string text;
    {
        std::lock_guard lock(nested->monitor());
        if (nested->items().empty())
            return;
        nested->insert(0, userInfo_->snapshot());
        try {
            nlohmann::ordered_json document = nlohmann::ordered_json::array();
            for (const auto& item : nested->items())
                document.push_back(toJson(item));
            text = document.dump(4, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
        } catch (const std::exception& error) {
            MXLOG(logScope(), Error, "dataWithJSONObject: {}", error.what());
        }
    }

    auto& fileSystem = ProcessWide<FileSystem>::get();
    auto directory = fileSystem.resolve(kSummaryDirectory);
    if (auto failure = fileSystem.createDirectories(directory, 0777))
        MXLOG(logScope(), Error, "can't create logging directory at {}: {}", directory.string(), *failure);
    if (text.empty())
        return;
    if (auto failure = fileSystem.writeAtomically(directory / summaryFileName(std::time(nullptr)), text))
        MXLOG(logScope(), Error, "jsonOutput writeToURL: {}", *failure);
}

void MxReportingSession::appendAggregated(const MxAtomicProperty<AggregationArray>& field, Value value)
{
    // The field is read again under the array's monitor: an append races a stop (or a
    // restart) either into the live array or into nothing, never into a dropped one.
    for (;;) {
        auto array = field.get();
        if (!array)
            return;
        std::lock_guard lock(array->monitor());
        auto current = field.get();
        if (current == array) {
            array->append(std::move(value));
            return;
        }
    }
}

void MxReportingSession::dropAggregated(MxAtomicProperty<AggregationArray>& field)
{
    auto array = field.get();
    if (!array)
        return;
    std::lock_guard lock(array->monitor());
    field.set(nullptr);
}

std::string MxReportingSession::description() const
{
    return fmt::format("<MxReportingSession reporterID={} serviceType={} started={}>", reporterID_, serviceType(),
                       started() ? "YES" : "NO");
}

} // namespace mx
