#pragma once
// The endpoint of one client connection: implements the request protocol, owns the
// sessions its client creates, and reaches other clients' sessions, the reporting
// switch and the driver statistics through the service root (held weakly).
// Requests enter on the connection layer's threads, where they are only logged and
// queued on the one serial server queue; there every client's requests run one at a
// time, whole, in the order they arrived. Nothing here holds a client back: the
// connection stops reading a client that owes past its backlog bound (BacklogAccount),
// before its requests arrive. The session map and the indexes kept beside it live on
// the server queue.

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/MxAtomicProperty.h"
#include "Statistics/Service/MxReportingServiceDelegateProtocol.h"
#include "Statistics/Service/MxReportingServiceProtocol.h"
#include "Statistics/Service/MxReportingSession.h"
#include "platform/BacklogAccount.h"
#include "platform/MxLog.h"
#include "platform/UniqueFunction.h"
#include "platform/WorkQueue.h"

namespace mx {

class MxReportingServerInstance final : public MxReportingServiceProtocol,
                                        public std::enable_shared_from_this<MxReportingServerInstance> {
public:
    using SessionMap = std::map<ReporterID, std::shared_ptr<MxReportingSession>>;

    // Sessions one connection may hold, and the whole service: each costs memory (and,
    // started, a held reply) until it is destroyed or its client leaves. A create past
    // either is refused whole, and makes nothing.
    static constexpr std::size_t kMaximumSessions = 4096;
    static constexpr std::size_t kMaximumSessionsInService = 16384;
    // What a client may owe the stores and their queues before its connection is no
    // longer read (BacklogAccount): what it sends while its rows fill a batch, about
    // 560 KiB at 10 000 reports a second, with room to spare. Each busy client may hold
    // this much of the daemon's memory, and about twice as much again in the decoded
    // reports it stands for.
    static constexpr std::size_t kBacklogBound = std::size_t{1} << 20;

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
    // Server queue only: its sessions that are started now, in the map's order.
    const SessionMap& startedSessions() const { return startedSessions_; }
    // Server queue only: every session of the map described, as a message without an ID
    // list logs them; made again only after one of them changed.
    const std::string& sessionListing();

    // Server queue only. The own session of that ID, else (when `acrossAllClients`)
    // the root's cross-client lookup.
    std::shared_ptr<MxReportingSession> findReportingSessionForID(ReporterID reporterID, bool acrossAllClients);

    void createReportingSession(ReporterID reporterID, MxCreateReply reply) override;
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
    // What its client owes the stores and backends, charged by the work its requests
    // leave behind; the connection is not read while it is overdrawn.
    const std::shared_ptr<BacklogAccount>& backlog() const { return backlog_; }

private:
    struct FanOut;

    // Queues `work` on the server queue, run with this client's account named and one
    // item charged `weight`; any thread.
    template <class Work>
    void enqueue(Work work, std::size_t weight = 0);

    void handleCreate(ReporterID reporterID, const MxCreateReply& reply);
    void handleSetServiceType(ServiceType serviceType, ReporterID reporterID, const MxBoolReply& reply);
    void handleGetServiceName(ReporterID reporterID, const MxServiceTypeReply& reply);
    void handleSetConfiguration(const std::optional<Dictionary>& configuration, ReporterID reporterID,
                                const MxBoolReply& reply);
    void handleStart(ReporterID reporterID, const MxHeldReply& reply);
    void handleSendMessage(FanOut& message);
    void sendToListedSessions(const FanOut& message);
    // Every started session of every client, or alone when there is none.
    void sendToStartedSessions(const FanOut& message, MxReportingServiceDelegateProtocol& root);
    // The sessions a message would reach whose period keeps what they are sent, once
    // for each time it would reach them; found without a line in the log.
    std::vector<std::shared_ptr<MxReportingSession>> sessionsKeeping(const FanOut& message,
                                                                     MxReportingServiceDelegateProtocol& root) const;
    // The limit the message would pass in what those sessions keep, or nothing.
    static std::optional<std::string> keepingLimit(const FanOut& message,
                                                   const std::vector<std::shared_ptr<MxReportingSession>>& sessions,
                                                   MxReportingServiceDelegateProtocol& root);
    void handleStop(ReporterID reporterID, const MxBoolReply& reply);
    void sendDriverStatistics(MxReportingSession& session, const std::optional<Dictionary>& statistics);
    void handleDestroy(ReporterID reporterID, const MxBoolReply& reply);
    void handleValid(ReporterID reporterID, const MxDictionaryReply& reply);
    void handleGetAllReporters(const MxReportersReply& reply);
    void handleDisconnection();

    // Keeps the started index and the listing true to one of the map's sessions after
    // it changed.
    void sessionChanged(ReporterID reporterID, const MxReportingSession& session);
    void forgetSession(ReporterID reporterID);

    const std::int32_t processIdentifier_;
    MxAtomicProperty<std::optional<Date>> clientStartDate_;
    MxAtomicProperty<std::optional<std::string>> clientProcessName_;
    SessionMap clientReportingSessionMap_;
    SessionMap startedSessions_;
    std::optional<std::string> sessionListing_; // nothing: made again when asked for
    const std::weak_ptr<MxReportingServiceDelegateProtocol> delegate_;
    const std::shared_ptr<WorkQueue> serverQueue_;
    const std::shared_ptr<BacklogAccount> backlog_ = std::make_shared<BacklogAccount>(kBacklogBound);
};

} // namespace mx
