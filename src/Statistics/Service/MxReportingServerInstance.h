#pragma once
// The endpoint of one client connection: implements the request protocol, owns the
// sessions its client creates, and reaches other clients' sessions, the reporting
// switch and the driver statistics through the service root (held weakly).
// Requests enter on the connection layer's threads, where they are only logged and
// queued on the endpoint's own line; everything else, the session map included, lives
// on the one serial server queue, where each client's requests run in turns, in the
// order they came: a few at a time, then the other clients' turns. A client whose
// reports wait unwritten past its backlog bound gets no turn until they are written,
// and a request whose work is long (a message to many sessions, reading the drivers'
// channels) takes several, so no client keeps the others waiting.

#include <atomic>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

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

    // Sessions one client may hold at once: each costs memory (and, started, a held
    // reply) until it is destroyed or its client leaves. A create beyond it makes
    // nothing, answers true like any create that makes nothing, and says so in the log.
    static constexpr std::size_t kMaximumSessions = 1024;
    // What a client may owe the stores and their queues before its requests wait
    // (BacklogAccount): what it sends while its deliveries gather (40 ms) and its rows
    // fill a batch, about 560 KiB at 10 000 reports a second, with room to spare. Each
    // busy client may hold this much of the daemon's memory, and about twice as much
    // again in the decoded reports it stands for.
    static constexpr std::size_t kBacklogBound = std::size_t{1} << 20;
    // Steps of one client's requests run in a turn before the others' turns come.
    static constexpr int kStepsPerTurn = 16;
    // Sessions a message reaches in one step.
    static constexpr std::size_t kSessionsPerStep = 64;

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
    // Bytes its client owes the stores and their queues now, and whether its requests
    // wait for them to be written.
    std::size_t backlogBytes() const { return backlog_->owed(); }
    bool heldBack() const { return heldBack_.load(); }

private:
    // Where a request's work stands after a step: done; more steps to come, after the
    // other clients' turns; or waiting until something else resumes the endpoint.
    enum class Step { Done, Again, Wait };
    using Work = UniqueFunction<Step(MxReportingServerInstance&)>;
    struct Pending {
        Work work;
        std::size_t weight; // what each item it queues for the stores is charged
    };
    struct FanOut;
    struct Sampling;

    // Queues `work` on this endpoint's line; any thread.
    void enqueue(Work work, std::size_t weight = 0);
    template <class Handler>
    void enqueueOnce(Handler handler);
    void scheduleTurn();
    void runTurn();
    // Gives a waiting request its next step.
    void resume();
    // Runs `sample` where the drivers' channels are read and resumes the endpoint after
    // it: true, and the request waits. False when there is nowhere else (no driver has
    // channels): then it has run in place.
    bool sampleElsewhere(UniqueFunction<void()> sample);

    void handleCreate(ReporterID reporterID, const MxBoolReply& reply);
    void handleSetServiceType(ServiceType serviceType, ReporterID reporterID, const MxBoolReply& reply);
    void handleGetServiceName(ReporterID reporterID, const MxServiceTypeReply& reply);
    void handleSetConfiguration(const std::optional<Dictionary>& configuration, ReporterID reporterID,
                                const MxBoolReply& reply);
    Step handleStart(const std::shared_ptr<Sampling>& start, const MxHeldReply& reply);
    Step handleSendMessage(FanOut& message);
    // The first step of a message: false when that is all there is to it.
    bool beginSendMessage(FanOut& message);
    Step handleStop(const std::shared_ptr<Sampling>& stop, const MxBoolReply& reply);
    void sendDriverStatistics(MxReportingSession& session, const std::optional<Dictionary>& statistics);
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
    const std::shared_ptr<BacklogAccount> backlog_ = std::make_shared<BacklogAccount>(kBacklogBound);
    std::atomic<bool> heldBack_{false};

    std::mutex pendingMutex_;
    std::deque<Pending> pending_;
    // From the first request queued until the line is empty again: a turn is on the
    // server queue, or running, or the line waits (held back, or on a request).
    bool scheduled_ = false;
};

} // namespace mx
