#pragma once
// One reporter's session: its configuration, its aggregation of the messages it is
// sent, and its reporting periods from start to stop. Shared: the owning endpoint's
// session map holds it, and so does every job it queues until the job has run.
// Configuration, start, stop and message aggregation run on the server queue; the
// backend work runs on the session's own serial uplink queue (MxReportingSessionUplink)
// and the summary is written by MxReportingSessionSummary.

#include <atomic>
#include <cstdint>
#include <ctime>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/MxAtomicProperty.h"
#include "Statistics/MxLockedDictionary.h"
#include "Statistics/MxReportingAggregationArray.h"
#include "Statistics/MxReportingVocabulary.h"
#include "Statistics/Service/MxReportingServiceDelegateProtocol.h"
#include "Statistics/Service/MxReportingSessionUplink.h"
#include "platform/MxLog.h"
#include "platform/UniqueFunction.h"
#include "platform/Uplink.h"
#include "platform/WorkQueue.h"
#include "value/Value.h"

namespace mx {

// Spaces in top-level string keys become "_"; values are kept as they are. Of two
// keys that clean to the same text, the later one's value wins.
Dictionary MxReportingCleanKeys(const Dictionary& message);

class MxReportingSession : public std::enable_shared_from_this<MxReportingSession> {
public:
    using TransactionCompleteBlock = std::function<void(bool)>;
    using SendReply = MxReportingSessionUplink::SendReply;
    using AggregationArray = std::shared_ptr<MxReportingAggregationArray>;

    // What one session's period, and every session's together, may keep of the reports
    // it is sent (counted as encoded, MxReportingEncodedArena): the summary built from it
    // at stop runs on the server queue and takes about a second at most. A message that
    // would pass either is refused whole.
    static constexpr std::size_t kMaximumKeptBytes = std::size_t{64} << 20;
    static constexpr std::size_t kMaximumKeptBytesInService = std::size_t{512} << 20;
    // What keeping one message costs a period beyond its payload: its identifier and
    // its place in both stores.
    static constexpr std::size_t kKeptBytesPerMessage = 64;
    // Told, on the server queue, each time the session's description changes (its
    // service type, started or stopped): its owner keeps its indexes by it.
    using ChangeObserver = std::function<void(const MxReportingSession&)>;

    // initWithID:processIdentifiers:
    MxReportingSession(ReporterID reporterID, std::vector<std::int32_t> processIdentifiers);
    ~MxReportingSession();
    MxReportingSession(const MxReportingSession&) = delete;
    MxReportingSession& operator=(const MxReportingSession&) = delete;

    // The "mxrr" scope every line of a session goes to, registered on first use.
    static const MxLogScope* logScope();

    bool started() const { return started_.load(); }
    bool uplinkSessionStarted() const { return uplink_.uplinkSessionStarted(); }
    ServiceType serviceType() const { return serviceType_.load(std::memory_order_relaxed); }
    const std::shared_ptr<MxLockedDictionary>& userInfo() const { return userInfo_; }
    // The drivers' snapshot of the current period, kept here for the endpoint that
    // took it; the session itself never reads it.
    std::shared_ptr<MxReportingDriverSnapShot> driverSnapShot() const { return driverSnapShot_.get(); }
    void setDriverSnapShot(std::shared_ptr<MxReportingDriverSnapShot> snapShot)
    {
        driverSnapShot_.set(std::move(snapShot));
    }
    ReporterID reporterID() const { return reporterID_; }
    const std::vector<std::int32_t>& processIdentifiers() const { return processIdentifiers_; }
    AggregationArray aggregatedPayloadData() const { return aggregatedPayloadData_.get(); }
    AggregationArray nestedAggregatedPayloadData() const { return nestedAggregatedPayloadData_.get(); }
    // Server queue only.
    const std::map<std::string, std::int64_t>& messageTypeCounts() const { return messageTypeCounts_; }
    // Set once, by the owner, before the session is shared.
    void setChangeObserver(ChangeObserver observer) { changeObserver_ = std::move(observer); }
    // What the current period keeps, as encoded; nothing while no period keeps anything
    // (after a stop, until the next start).
    std::optional<std::size_t> keptBytes() const;
    // What sending `message` would add to a period's keeping.
    static std::size_t keptBytesOf(const Dictionary& message);
    static std::size_t keptBytesInService() { return MxReportingEncodedArena::keptInAll(); }
    std::string serviceName() const { return serviceName_.get(); }
    std::shared_ptr<UplinkSession> uplinkSession() const { return uplink_.uplinkSession(); }
    std::optional<UplinkSecureHierarchyToken> uplinkAgentToken() const { return uplink_.uplinkAgentToken(); }
    const std::shared_ptr<WorkQueue>& uplinkQueue() const { return uplink_.queue(); }

    // The start request's reply waits here until the period ends. Parking a reply
    // answers one still parked from an earlier start first (true); completing answers
    // the parked one (true) and forgets it. Server queue only.
    bool hasTransactionCompleteBlock() const { return static_cast<bool>(transactionCompleteBlock_.get()); }
    void parkTransactionCompleteBlock(TransactionCompleteBlock block);
    void completeTransaction();

    void setServiceType(ServiceType serviceType);
    void setConfiguration(const std::optional<Dictionary>& configuration);
    void updateDefaults(const std::optional<Dictionary>& defaults);

    void start();
    void stop();

    // Counts the message and returns its identifier ("Session_Playback_Start_1").
    std::string messageIdForCategory(MessageCategory category, MessageType type);
    // Cleans, counts and aggregates the message on the calling thread, then queues its
    // delivery. `sync` is accepted and ignored: delivery is always asynchronous.
    // `reply`, when given, is answered at once with no error.
    void sendMessage(const Dictionary& message, MessageCategory category, MessageType type, bool sync, SendReply reply);
    void sendMessage(const Dictionary& message, MessageCategory category, MessageType type, SendReply reply);

    static void sendSingleMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                  ServiceType serviceType, const Dictionary* userInfo, SendReply reply)
    {
        MxReportingSessionUplink::sendSingleMessage(message, category, type, serviceType, userInfo, std::move(reply));
    }

    // Whether this session records orientation changes: asked at every start and stop.
    bool shouldReportOrientation() const;
    std::optional<std::string> orientationCallbackID() const { return orientationCallbackID_.get(); }

    std::optional<Dictionary> createSummaryEventForSession();
    void writeSummaryJson();
    std::string summaryFileName(std::time_t now) const;

    std::string description() const;

private:
    void changed() const;
    void registerOrientation();
    void unregisterOrientation();
    // `mode` is "device" or "ui"; runs on a thread of the orientation service.
    void recordOrientation(std::string_view mode, int orientation);
    // Server queue only: `job` runs on the uplink side after every job given before.
    template <class F>
    void runUplinkJob(F job);
    // New empty stores for a period, sharing one arena.
    void makePeriodStores();
    // Keeps a message in both stores: as it is, and under its identifier.
    void aggregate(const std::string& identifier, const Dictionary& cleaned);
    // False when the store is gone (the session stopped).
    static bool appendAggregated(const MxAtomicProperty<AggregationArray>& field,
                                 const std::function<void(MxReportingAggregationArray&)>& append);
    static void dropAggregated(MxAtomicProperty<AggregationArray>& field);

    std::atomic<bool> started_{false};
    std::atomic<ServiceType> serviceType_{service_type::kUnknown};
    std::shared_ptr<MxLockedDictionary> userInfo_ = std::make_shared<MxLockedDictionary>();
    MxAtomicProperty<std::shared_ptr<MxReportingDriverSnapShot>> driverSnapShot_;
    MxAtomicProperty<TransactionCompleteBlock> transactionCompleteBlock_;
    const ReporterID reporterID_;
    const std::vector<std::int32_t> processIdentifiers_;
    MxAtomicProperty<AggregationArray> aggregatedPayloadData_;
    MxAtomicProperty<AggregationArray> nestedAggregatedPayloadData_;
    std::map<std::string, std::int64_t> messageTypeCounts_;
    MxAtomicProperty<std::string> serviceName_{std::string("unknown")};
    MxAtomicProperty<std::optional<std::string>> orientationCallbackID_;
    MxAtomicProperty<std::optional<Date>> startDate_;
    ChangeObserver changeObserver_;
    MxReportingSessionUplink uplink_;
};

} // namespace mx
