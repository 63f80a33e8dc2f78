#include "Statistics/Service/MxReportingSession.h"

#include <cmath>

#include <fmt/format.h>

#include "Statistics/Service/MxReportingSessionSummary.h"
#include "platform/BacklogAccount.h"
#include "platform/DeviceProperties.h"
#include "platform/Orientation.h"
#include "platform/ReplyGate.h"
#include "platform/TracePoints.h"
#include "wire/MsgpackValue.h"

namespace mx {

namespace {

constexpr std::uint32_t kTraceSessionCreated = 0x21042828;
constexpr std::uint32_t kTraceSessionStarted = 0x2104282C;
constexpr std::uint32_t kTraceSessionStopping = 0x21042830;
constexpr std::uint32_t kTraceSessionDestroyed = 0x21042834;
constexpr std::uint32_t kTraceMessageQueued = 0x21042838;

// Most payloads carry no spaced key; they are shared as they are, not rebuilt.
bool hasSpacedKey(const Dictionary& message)
{
    for (const auto& [key, value] : message)
        if (key.find(' ') != std::string::npos)
            return true;
    return false;
}

} // namespace

Dictionary MxReportingCleanKeys(const Dictionary& message)
{
    if (!hasSpacedKey(message))
        return message;
    Dictionary cleaned;
    cleaned.reserve(message.size());
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
    static const MxLogScope* scope =
        MxLogRegisterScope(1, MxFourCharCode("mxrr"), "mxrr", "com.kestrel.harmonia", "reporting_session_verbose", 31);
    return scope;
}

MxReportingSession::MxReportingSession(ReporterID reporterID, std::vector<std::int32_t> processIdentifiers)
    : reporterID_(reporterID), processIdentifiers_(std::move(processIdentifiers)), uplink_(reporterID)
{
    makePeriodStores();
    MXLOG(logScope(), Info, "created reporting session for ID: {}", reporterID_);
    MxTrace(kTraceSessionCreated);
}

MxReportingSession::~MxReportingSession()
{
    MxTrace(kTraceSessionDestroyed);
    MXLOG(logScope(), Info, "deallocing this session {}", reporterID_);
}

void MxReportingSession::changed() const
{
    if (changeObserver_)
        changeObserver_(*this);
}

void MxReportingSession::setServiceType(ServiceType serviceType)
{
    serviceType_.store(serviceType, std::memory_order_relaxed);
    std::string name = MxReportingServiceTypeName(serviceType);
    MXLOG(logScope(), Info, "setting service type {}", name);
    serviceName_.set(std::move(name));
    changed();
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
    started_.store(true);
    makePeriodStores();
    MxTrace(kTraceSessionStarted);
    changed();
    if (shouldReportOrientation())
        registerOrientation();

    MxReportingSessionUplink::Configuration configuration{userInfo_, serviceName(), serviceType(),
                                                          uplinkSessionStarted()};
    // Queued, not run in place: configuration merged before it runs reaches the
    // backend session too.
    uplink_.runOnQueue(
        [this, configuration = std::move(configuration)] {
            return uplink_.configure(serviceType(), configuration, shared_from_this());
        },
        shared_from_this());
}

void MxReportingSession::stop()
{
    MXLOG_VERBOSE(logScope(), "ending session {}", reporterID_);
    // Asked again, whatever the session was started as: a session retyped while
    // started keeps its registration, as intended.
    if (shouldReportOrientation() && orientationCallbackID())
        unregisterOrientation();
    if (!started())
        return;
    // Intended: the same verbose line once more for a session that was started.
    MXLOG_VERBOSE(logScope(), "ending session {}", reporterID_);
    MxTrace(kTraceSessionStopping);

    if (auto summary = createSummaryEventForSession()) {
        MXLOG(logScope(), Default, "sending summary event for reporter {}", reporterID_);
        sendMessage(*summary, message_category::kSummary, message_type::kSummary, true, nullptr);
    }
    writeSummaryJson();

    runUplinkJob([this] {
        uplink_.flush(serviceType());
        return MxReportingSessionUplink::JobEnd::Done;
    });

    dropAggregated(aggregatedPayloadData_);
    dropAggregated(nestedAggregatedPayloadData_);
    started_.store(false);
    changed();
}

void MxReportingSession::parkTransactionCompleteBlock(TransactionCompleteBlock block)
{
    completeTransaction();
    transactionCompleteBlock_.set(std::move(block));
}

void MxReportingSession::completeTransaction()
{
    if (auto pending = transactionCompleteBlock_.exchange(nullptr))
        pending(true);
}

std::string MxReportingSession::messageIdForCategory(MessageCategory category, MessageType type)
{
    std::string identifier = MxReportingCategoryName(category);
    identifier += '_';
    identifier += MxReportingMessageTypeName(type);
    auto count = ++messageTypeCounts_[identifier];
    identifier += '_';
    identifier += std::to_string(count);
    return identifier;
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
    aggregate(identifier, cleaned);
    MxTrace(kTraceMessageQueued);

    // Whether the message goes in-session or alone is decided now, not at delivery.
    runUplinkJob(
        [this, delivery = MxReportingSessionUplink::Delivery{std::move(cleaned), message, started(), category, type}] {
            uplink_.deliver(serviceType(), delivery, *userInfo_);
            return MxReportingSessionUplink::JobEnd::Done;
        });
    if (reply)
        reply(std::nullopt);
}

// Jobs hold the session only as `this`: the caller holds it while a job runs in place,
// and whatever runs the waiting ones holds it then. A job that waits behind another is
// owed by the client whose request gave it, until it has run, and so is what it
// writes; and it holds that request's reply until what it writes is kept.
template <class F>
void MxReportingSession::runUplinkJob(F job)
{
    if (uplink_.runNow(job))
        return;
    uplink_.runLater([job = std::move(job), debt = BacklogDebt::incur(), ticket = ReplyTicket::take()]() mutable {
        ScopedBacklogAccount charging(debt);
        auto end = MxReportingSessionUplink::JobEnd::Done;
        {
            ScopedReplyGate replying(ticket);
            end = job();
        }
        ticket.giveBack();
        return end;
    });
}

bool MxReportingSession::shouldReportOrientation() const
{
    if (!MxReportingInternalBuild())
        return false;
    ServiceType type = serviceType();
    if (type != service_type::kLongFormAudio && type != service_type::kTelephony)
        return false;
    return ProcessWide<DeviceProperties>::get().integerProperty("DeviceClassNumber") != 6;
}

void MxReportingSession::registerOrientation()
{
    std::string identifier = fmt::format("MxReportingService {}", reporterID_);
    orientationCallbackID_.set(identifier);
    startDate_.set(std::chrono::time_point_cast<Date::duration>(std::chrono::system_clock::now()));
    auto& orientation = ProcessWide<Orientation>::get();
    orientation.registerDeviceOrientation(
        identifier, [self = shared_from_this()](int value) { self->recordOrientation("device", value); });
    orientation.registerUIOrientation(identifier,
                                      [self = shared_from_this()](int value) { self->recordOrientation("ui", value); });
}

void MxReportingSession::unregisterOrientation()
{
    std::string identifier = *orientationCallbackID();
    auto& orientation = ProcessWide<Orientation>::get();
    orientation.unregisterDeviceOrientation(identifier);
    orientation.unregisterUIOrientation(identifier);
    orientationCallbackID_.set(std::nullopt);
}

void MxReportingSession::recordOrientation(std::string_view mode, int orientation)
{
    std::string text = ProcessWide<Orientation>::get().orientationName(orientation);
    auto now = std::chrono::system_clock::now();
    auto backToStart = std::chrono::duration<double>(startDate_.get().value_or(now) - now).count();
    double seconds = std::round(backToStart * 1000.0) / -1000.0;
    if (MxLogEnabled(logScope(), kMxLogVerboseLevel)) {
        auto app = userInfo_->find("HostApplicationDisplayID");
        MXLOG(logScope(), Debug,
              "Orientation handler callback mode={} orientation=\"{}\" app=\"{}\", time={}, id=\"{}\"", mode, text,
              app ? app->description() : std::string("(null)"), seconds, orientationCallbackID().value_or("(null)"));
    }
    Dictionary record;
    record.set(fmt::format("{}_orientation", mode), std::move(text));
    record.set(fmt::format("{}_orientation_time", mode), seconds);
    appendAggregated(aggregatedPayloadData_, [&](MxReportingAggregationArray& array) { array.append(record); });
}

std::optional<Dictionary> MxReportingSession::createSummaryEventForSession()
{
    auto array = aggregatedPayloadData();
    return MxReportingSessionSummary::createSummaryEvent(array.get(), serviceType());
}

void MxReportingSession::writeSummaryJson()
{
    auto nested = nestedAggregatedPayloadData();
    MxReportingSessionSummary::writeSummaryJson(nested.get(), userInfo_->snapshot(), serviceType());
}

std::string MxReportingSession::summaryFileName(std::time_t now) const
{
    return MxReportingSessionSummary::summaryFileName(now, userInfo_->snapshot(), serviceType());
}

std::optional<std::size_t> MxReportingSession::keptBytes() const
{
    auto current = aggregatedPayloadData();
    if (!current)
        return std::nullopt;
    return current->arena()->keptBytes();
}

std::size_t MxReportingSession::keptBytesOf(const Dictionary& message)
{
    return encodedMsgpackBytes(Value(message)) + kKeptBytesPerMessage;
}

void MxReportingSession::makePeriodStores()
{
    auto arena = std::make_shared<MxReportingEncodedArena>();
    aggregatedPayloadData_.set(std::make_shared<MxReportingAggregationArray>(arena));
    nestedAggregatedPayloadData_.set(std::make_shared<MxReportingAggregationArray>(arena));
}

void MxReportingSession::aggregate(const std::string& identifier, const Dictionary& cleaned)
{
    // Both stores change only here and at start and stop, all on the server queue:
    // the arena read now is the one both stores of the period share.
    auto current = aggregatedPayloadData();
    if (!current)
        return;
    auto payload = MxReportingAggregationArray::store(*current->arena(), cleaned);
    appendAggregated(aggregatedPayloadData_, [&](MxReportingAggregationArray& array) { array.appendStored(payload); });
    appendAggregated(nestedAggregatedPayloadData_,
                     [&](MxReportingAggregationArray& array) { array.appendStoredUnder(identifier, payload); });
}

bool MxReportingSession::appendAggregated(const MxAtomicProperty<AggregationArray>& field,
                                          const std::function<void(MxReportingAggregationArray&)>& append)
{
    // The field is read again under the array's monitor: an append races a stop (or a
    // restart) either into the live array or into nothing, never into a dropped one.
    for (;;) {
        auto array = field.get();
        if (!array)
            return false;
        std::lock_guard lock(array->monitor());
        auto current = field.get();
        if (current == array) {
            append(*array);
            return true;
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
