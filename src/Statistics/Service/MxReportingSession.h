#pragma once
// One reporter's session: its configuration, its aggregation of the messages it is
// sent, and its backend session. Shared: the owning endpoint's session map holds it,
// and so does every job it queues until the job has run.
// Configuration, start, stop and message aggregation run on the server queue;
// backend configuration, deliveries and flush run, in that order, on the session's
// own serial `uplinkQueue`.

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
#include "platform/MxLog.h"
#include "platform/UniqueFunction.h"
#include "platform/Uplink.h"
#include "platform/Value.h"
#include "platform/WorkQueue.h"

namespace mx {

struct MxReportingDiscovery;

// Spaces in top-level string keys become "_"; values are kept as they are. Of two
// keys that clean to the same text, the later one's value wins.
Dictionary MxReportingCleanKeys(const Dictionary& message);

class MxReportingSession : public std::enable_shared_from_this<MxReportingSession> {
public:
    using TransactionCompleteBlock = std::function<void(bool)>;
    using SendReply = UniqueFunction<void(std::optional<UplinkError>)>;
    using AggregationArray = std::shared_ptr<MxReportingAggregationArray>;

    // initWithID:processIdentifiers:
    MxReportingSession(ReporterID reporterID, std::vector<std::int32_t> processIdentifiers);
    ~MxReportingSession();
    MxReportingSession(const MxReportingSession&) = delete;
    MxReportingSession& operator=(const MxReportingSession&) = delete;

    // The "mxrr" scope every line of a session goes to, registered on first use.
    static const MxLogScope* logScope();

    bool started() const { return started_.load(); }
    void setStarted(bool started) { started_.store(started); }
    bool uplinkSessionStarted() const { return uplinkSessionStarted_.load(); }
    void setUplinkSessionStarted(bool started) { uplinkSessionStarted_.store(started); }
    ServiceType serviceType() const { return serviceType_.load(std::memory_order_relaxed); }
    const std::shared_ptr<MxLockedDictionary>& userInfo() const { return userInfo_; }
    std::shared_ptr<MxReportingDriverSnapShot> driverSnapShot() const { return driverSnapShot_.get(); }
    void setDriverSnapShot(std::shared_ptr<MxReportingDriverSnapShot> snapShot) { driverSnapShot_.set(std::move(snapShot)); }
    TransactionCompleteBlock transactionCompleteBlock() const { return transactionCompleteBlock_.get(); }
    void setTransactionCompleteBlock(TransactionCompleteBlock block) { transactionCompleteBlock_.set(std::move(block)); }
    ReporterID reporterID() const { return reporterID_; }
    const std::vector<std::int32_t>& processIdentifiers() const { return processIdentifiers_; }
    AggregationArray aggregatedPayloadData() const { return aggregatedPayloadData_.get(); }
    AggregationArray nestedAggregatedPayloadData() const { return nestedAggregatedPayloadData_.get(); }
    // Server queue only.
    const std::map<std::string, std::int64_t>& messageTypeCounts() const { return messageTypeCounts_; }
    std::string serviceName() const { return serviceName_.get(); }
    std::optional<std::string> orientationCallbackID() const { return orientationCallbackID_.get(); }
    std::optional<Date> startDate() const { return startDate_.get(); }
    std::shared_ptr<UplinkSession> uplinkSession() const { return uplinkSession_.get(); }
    void setUplinkSession(std::shared_ptr<UplinkSession> session) { uplinkSession_.set(std::move(session)); }
    std::optional<UplinkSecureHierarchyToken> uplinkAgentToken() const { return uplinkAgentToken_.get(); }
    const std::shared_ptr<WorkQueue>& uplinkQueue() const { return uplinkQueue_; }

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
    void sendMessage(const Dictionary& message, MessageCategory category, MessageType type, bool sync,
                     SendReply reply);
    void sendMessage(const Dictionary& message, MessageCategory category, MessageType type, SendReply reply);

    // One message with a throw-away backend session of its own, sent from the global
    // utility queue ("alarms" after a random delay of up to 59 seconds). `userInfo`
    // is accepted and ignored. `reply`, when given, gets the backend's error or nothing.
    static void sendSingleMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                  ServiceType serviceType, const Dictionary* userInfo, SendReply reply);

    // Every key that occurred in this period's payloads, with all of its values in
    // text form joined by ","; nothing when nothing was aggregated.
    std::optional<Dictionary> createSummaryEventForSession();
    // On internal builds: the user information and every message of this period, as
    // pretty-printed JSON in the summary directory. Nothing when nothing was sent.
    void writeSummaryJson();
    // "<local time>-harmonia-<host>-<service type name>.json", the host made safe to
    // stand in one file name.
    std::string summaryFileName(std::time_t now) const;

    std::string description() const;

private:
    void configureUplink(const std::shared_ptr<MxLockedDictionary>& userInfo, const std::string& serviceName,
                         ServiceType serviceType, const std::shared_ptr<MxReportingDiscovery>& discovery);
    void flushUplink();
    void deliver(const Dictionary& cleaned, const Dictionary& message, bool wasStarted, MessageCategory category,
                 MessageType type);

    static void appendAggregated(const MxAtomicProperty<AggregationArray>& field, Value value);
    static void dropAggregated(MxAtomicProperty<AggregationArray>& field);

    std::atomic<bool> started_{false};
    std::atomic<bool> uplinkSessionStarted_{false};
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
    MxAtomicProperty<std::shared_ptr<UplinkSession>> uplinkSession_;
    MxAtomicProperty<std::optional<UplinkSecureHierarchyToken>> uplinkAgentToken_;
    const std::shared_ptr<WorkQueue> uplinkQueue_;
};

} // namespace mx
