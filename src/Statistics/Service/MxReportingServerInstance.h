#pragma once
// The endpoint of one client connection: implements the request protocol, owns the
// sessions its client creates, and reaches other clients' sessions, the reporting
// switch and the driver statistics through the service root (held weakly).
// Requests enter on the connection layer's threads, where they are only logged and
// queued; everything else, the session map included, lives on the one serial server
// queue.

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "Statistics/MxAtomicProperty.h"
#include "Statistics/Service/MxReportingServiceDelegateProtocol.h"
#include "Statistics/Service/MxReportingServiceProtocol.h"
#include "Statistics/Service/MxReportingSession.h"
#include "platform/MxLog.h"
#include "platform/WorkQueue.h"

namespace mx {

class MxReportingServerInstance final : public MxReportingServiceProtocol,
                                        public std::enable_shared_from_this<MxReportingServerInstance> {
public:
    using SessionMap = std::map<ReporterID, std::shared_ptr<MxReportingSession>>;

    // Sessions one client may hold at once: each costs memory (and, started, a held
    // reply) until it is destroyed or its client leaves. A create beyond it makes
    // nothing, answers true like any create that makes nothing, and says so in the log.
    static constexpr std::size_t kMaximumSessions = 1024;

    // initWithPID:delegate:
    MxReportingServerInstance(std::int32_t processIdentifier,
                              std::weak_ptr<MxReportingServiceDelegateProtocol> delegate,
                              std::shared_ptr<WorkQueue> serverQueue);
    ~MxReportingServerInstance() override;

    // The "mxrs" scope of every line of the service host.
    static const MxLogScope* logScope();

    std::int32_t processIdentifier() const { return processIdentifier_; }
    std::optional<Date> clientStartDate() const { return clientStartDate_.get(); }
    void setClientStartDate(std::optional<Date> date) { clientStartDate_.set(date); }
    std::optional<std::string> clientProcessName() const { return clientProcessName_.get(); }
    void setClientProcessName(std::optional<std::string> name) { clientProcessName_.set(std::move(name)); }
    // Server queue only.
    const SessionMap& clientReportingSessionMap() const { return clientReportingSessionMap_; }

    // Server queue only. The own session of that ID, else (when `acrossAllClients`)
    // the root's cross-client lookup.
    std::shared_ptr<MxReportingSession> findReportingSessionForID(ReporterID reporterID, bool acrossAllClients);

    void createReportingSession(ReporterID reporterID, MxBoolReply reply) override;
    void setServiceType(ServiceType serviceType, ReporterID reporterID, MxBoolReply reply) override;
    void getServiceNameForReporterID(ReporterID reporterID, MxServiceTypeReply reply) override;
    void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID, MxBoolReply reply) override;
    void startReportingSessionForID(ReporterID reporterID, MxHeldReply reply) override;
    void sendMessage(Dictionary payload, MessageCategory category, MessageType type, std::optional<Array> reportingIDs,
                     MxErrorReply reply) override;
    void stopReportingSessionForID(ReporterID reporterID, MxBoolReply reply) override;
    void destroyReportingSession(ReporterID reporterID, MxBoolReply reply) override;
    void reporterID(ReporterID reporterID, MxDictionaryReply valid) override;
    void getAllReporters(MxReportersReply reply) override;
    void killService(MxBoolReply reply) override;

    // Called by the root's connection handlers when the connection is interrupted or
    // invalidated: queues the stop of every started session and the removal from the
    // root. Only the first clean-up of an instance does anything.
    void handleConnectionError();

    std::string description() const;

private:
    template <class Work>
    void enqueue(Work work);

    void handleCreate(ReporterID reporterID, const MxBoolReply& reply);
    void handleSetServiceType(ServiceType serviceType, ReporterID reporterID, const MxBoolReply& reply);
    void handleGetServiceName(ReporterID reporterID, const MxServiceTypeReply& reply);
    void handleSetConfiguration(const std::optional<Dictionary>& configuration, ReporterID reporterID,
                                const MxBoolReply& reply);
    void handleStart(ReporterID reporterID, const MxHeldReply& reply);
    void handleSendMessage(const Dictionary& payload, MessageCategory category, MessageType type,
                           const std::optional<Array>& reportingIDs, const MxErrorReply& reply);
    void sendToStartedSessions(const Dictionary& payload, MessageCategory category, MessageType type,
                               MxReportingServiceDelegateProtocol& root);
    void handleStop(ReporterID reporterID, const MxBoolReply& reply);
    void sendDriverStatistics(MxReportingSession& session);
    void handleDestroy(ReporterID reporterID, const MxBoolReply& reply);
    void handleValid(ReporterID reporterID, const MxDictionaryReply& reply);
    void handleGetAllReporters(const MxReportersReply& reply);
    void handleDisconnection();

    const std::int32_t processIdentifier_;
    MxAtomicProperty<std::optional<Date>> clientStartDate_;
    MxAtomicProperty<std::optional<std::string>> clientProcessName_;
    SessionMap clientReportingSessionMap_;
    const std::weak_ptr<MxReportingServiceDelegateProtocol> delegate_;
    const std::shared_ptr<WorkQueue> serverQueue_;
};

} // namespace mx
