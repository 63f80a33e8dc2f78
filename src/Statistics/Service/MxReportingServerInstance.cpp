#include "Statistics/Service/MxReportingServerInstance.h"

#include <cassert>
#include <cstdlib>

#include <fmt/format.h>

#include "Statistics/MxReportingJouleUtility.h"
#include "Statistics/MxReportingTallyBridge.h"
#include "platform/TracePoints.h"

namespace mx {

namespace {

constexpr std::uint32_t kTraceCreate = 0x21042814;
constexpr std::uint32_t kTraceStart = 0x21042818;
constexpr std::uint32_t kTraceStop = 0x2104281C;
constexpr std::uint32_t kTraceDestroy = 0x21042820;
constexpr std::uint32_t kTraceMessage = 0x21042824;

constexpr int kKillServiceExitStatus = 2;

// A broadcast's log lines name the sessions it reaches: the first few of them, so that
// a line stays a line however many sessions there are.
constexpr std::size_t kSessionsListed = 16;

std::string describeSessions(const std::vector<std::shared_ptr<MxReportingSession>>& sessions)
{
    std::string text = "(";
    for (std::size_t i = 0; i < sessions.size() && i < kSessionsListed; ++i) {
        text += i == 0 ? "" : ", ";
        text += sessions[i]->description();
    }
    if (sessions.size() > kSessionsListed)
        text += fmt::format(", and {} more", sessions.size() - kSessionsListed);
    return text + ")";
}

} // namespace

const MxLogScope* MxReportingServerInstance::logScope()
{
    static const MxLogScope* scope =
        MxLogRegisterScope(1, MxFourCharCode("mxrs"), "mxrs", "com.kestrel.harmonia", "reporting_server_verbose", 31);
    return scope;
}

MxReportingServerInstance::MxReportingServerInstance(std::int32_t processIdentifier,
                                                     std::weak_ptr<MxReportingServiceDelegateProtocol> delegate,
                                                     std::shared_ptr<WorkQueue> serverQueue)
    : processIdentifier_(processIdentifier), delegate_(std::move(delegate)), serverQueue_(std::move(serverQueue))
{
    MXLOG(logScope(), Default, "new client with pid {}", processIdentifier_);
}

MxReportingServerInstance::~MxReportingServerInstance()
{
    MXLOG(logScope(), Default, "dealloc {} from the server client list", processIdentifier_);
}

std::string MxReportingServerInstance::description() const
{
    return fmt::format("<MxReportingServerInstance pid={}>", processIdentifier_);
}

// A message on its way to its sessions, a step at a time.
struct MxReportingServerInstance::FanOut {
    Dictionary payload;
    MessageCategory category;
    MessageType type;
    std::optional<Array> reportingIDs;
    MxErrorReply reply;
    bool begun = false;
    // Without an ID list: the sessions started when the message came.
    std::vector<std::shared_ptr<MxReportingSession>> sessions;
    std::size_t next = 0; // the next ID, or the next session
};

// A start or a stop, which reads the drivers' channels on the way.
struct MxReportingServerInstance::Sampling {
    ReporterID reporterID;
    std::shared_ptr<MxReportingSession> session; // once found
    std::shared_ptr<MxReportingDriverSnapShot> snapShot;
    std::optional<Dictionary> statistics;
};

void MxReportingServerInstance::enqueue(Work work, std::size_t weight)
{
    {
        std::lock_guard lock(pendingMutex_);
        pending_.push_back({std::move(work), weight});
        if (std::exchange(scheduled_, true))
            return;
    }
    scheduleTurn();
}

template <class Handler>
void MxReportingServerInstance::enqueueOnce(Handler handler)
{
    enqueue([handler = std::move(handler)](MxReportingServerInstance& self) mutable {
        handler(self);
        return Step::Done;
    });
}

// A turn holds the endpoint weakly: one that is gone before its turn leaves nothing
// to do, and nobody to answer.
void MxReportingServerInstance::scheduleTurn()
{
    serverQueue_->dispatch([weakSelf = weak_from_this()] {
        if (auto self = weakSelf.lock())
            self->runTurn();
    });
}

void MxReportingServerInstance::resume() { scheduleTurn(); }

void MxReportingServerInstance::runTurn()
{
    assert(serverQueue_->isCurrent());
    for (int steps = 0; steps < kStepsPerTurn; ++steps) {
        if (backlog_->overdrawn()) {
            // Its next turn comes once what it owes is written; the line stays
            // scheduled meanwhile, so nothing else starts one.
            heldBack_.store(true);
            backlog_->whenSettled([weakSelf = weak_from_this()] {
                if (auto self = weakSelf.lock()) {
                    self->heldBack_.store(false);
                    self->scheduleTurn();
                }
            });
            return;
        }
        Pending* next = nullptr;
        {
            std::lock_guard lock(pendingMutex_);
            if (pending_.empty()) {
                scheduled_ = false;
                return;
            }
            next = &pending_.front();
        }
        Step step = Step::Done;
        {
            ScopedBacklogAccount charging(backlog_, next->weight);
            step = next->work(*this);
        }
        if (step == Step::Wait)
            return;
        if (step == Step::Done) {
            Pending done;
            std::lock_guard lock(pendingMutex_);
            done = std::move(pending_.front());
            pending_.pop_front();
        }
    }
    scheduleTurn();
}

bool MxReportingServerInstance::sampleElsewhere(UniqueFunction<void()> sample)
{
    auto root = delegate_.lock();
    auto queue = root ? root->driverSamplingQueue() : nullptr;
    if (!queue) {
        sample();
        return false;
    }
    queue->dispatch([weakSelf = weak_from_this(), sample = std::move(sample)]() mutable {
        sample();
        if (auto self = weakSelf.lock())
            self->resume();
    });
    return true;
}

std::shared_ptr<MxReportingSession> MxReportingServerInstance::findReportingSessionForID(ReporterID reporterID,
                                                                                         bool acrossAllClients)
{
    assert(serverQueue_->isCurrent());
    auto own = clientReportingSessionMap_.find(reporterID);
    if (own != clientReportingSessionMap_.end())
        return own->second;
    if (!acrossAllClients)
        return nullptr;
    auto root = delegate_.lock();
    return root ? root->findReportingSessionForID(reporterID) : nullptr;
}

// ---- Entry points: connection layer threads. Log and queue, nothing else.

void MxReportingServerInstance::createReportingSession(ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "creating session for reporter {}", reporterID);
    enqueueOnce([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleCreate(reporterID, reply);
    });
}

void MxReportingServerInstance::setServiceType(ServiceType serviceType, ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "setting service type {} for reporter {}", serviceType, reporterID);
    enqueueOnce([serviceType, reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleSetServiceType(serviceType, reporterID, reply);
    });
}

void MxReportingServerInstance::getServiceNameForReporterID(ReporterID reporterID, MxServiceTypeReply reply)
{
    // Intended: the log texts of this endpoint keep their spelling ("seviceType",
    // "returnning", the doubled space), which log searches rely on.
    MXLOG_VERBOSE(logScope(), "fetching seviceType");
    enqueueOnce([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleGetServiceName(reporterID, reply);
    });
}

void MxReportingServerInstance::setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                                                 MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "setting configuration");
    enqueueOnce([configuration = std::move(configuration), reporterID,
                 reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleSetConfiguration(configuration, reporterID, reply);
    });
}

void MxReportingServerInstance::startReportingSessionForID(ReporterID reporterID, MxHeldReply reply)
{
    MXLOG_VERBOSE(logScope(), "starting session for reporter {}", reporterID);
    enqueue([start = std::make_shared<Sampling>(Sampling{reporterID, nullptr, nullptr, std::nullopt}),
             reply = std::move(reply)](MxReportingServerInstance& self) { return self.handleStart(start, reply); });
}

void MxReportingServerInstance::sendMessage(Dictionary payload, MessageCategory category, MessageType type,
                                            std::optional<Array> reportingIDs, MxErrorReply reply)
{
    MXLOG_VERBOSE(logScope(), "sending message for reporter {}",
                  reportingIDs ? Value(*reportingIDs).description() : std::string("(null)"));
    // What each row and delivery it leaves behind is charged: the payload they share.
    std::size_t weight = approximateBytes(Value(payload));
    enqueue([message = FanOut{std::move(payload), category, type, std::move(reportingIDs), std::move(reply)}](
                MxReportingServerInstance& self) mutable { return self.handleSendMessage(message); },
            weight);
}

void MxReportingServerInstance::stopReportingSessionForID(ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "stopping session for reporter {}", reporterID);
    enqueue([stop = std::make_shared<Sampling>(Sampling{reporterID, nullptr, nullptr, std::nullopt}),
             reply = std::move(reply)](MxReportingServerInstance& self) { return self.handleStop(stop, reply); });
}

void MxReportingServerInstance::destroyReportingSession(ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "destroying session for reporter {}", reporterID);
    enqueueOnce([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleDestroy(reporterID, reply);
    });
}

void MxReportingServerInstance::reporterID(ReporterID reporterID, MxDictionaryReply valid)
{
    MXLOG_VERBOSE(logScope(), "validating reporter {}", reporterID);
    enqueueOnce([reporterID, valid = std::move(valid)](MxReportingServerInstance& self) {
        self.handleValid(reporterID, valid);
    });
}

void MxReportingServerInstance::getAllReporters(MxReportersReply reply)
{
    enqueueOnce([reply = std::move(reply)](MxReportingServerInstance& self) { self.handleGetAllReporters(reply); });
}

void MxReportingServerInstance::killService(MxBoolReply)
{
    MXLOG(logScope(), Default, "DESTROYING SERVICE");
    std::_Exit(kKillServiceExitStatus);
}

void MxReportingServerInstance::handleConnectionError()
{
    enqueueOnce([](MxReportingServerInstance& self) { self.handleDisconnection(); });
}

// ---- Work: server queue.

void MxReportingServerInstance::handleCreate(ReporterID reporterID, const MxBoolReply& reply)
{
    MxTrace(kTraceCreate);
    if (clientReportingSessionMap_.size() >= kMaximumSessions && !clientReportingSessionMap_.contains(reporterID)) {
        MXLOG(logScope(), Error,
              "session limit reached: client pid {} holds {} sessions, none made for reporter {} (destroy one first)",
              processIdentifier_, clientReportingSessionMap_.size(), reporterID);
        reply(true);
        return;
    }
    clientReportingSessionMap_[reporterID] =
        std::make_shared<MxReportingSession>(reporterID, std::vector<std::int32_t>{processIdentifier_});
    MXLOG(logScope(), Default, "session created for reporter {}", reporterID);
    reply(true);
}

void MxReportingServerInstance::handleSetServiceType(ServiceType serviceType, ReporterID reporterID,
                                                     const MxBoolReply& reply)
{
    if (reporterID != 0)
        if (auto session = findReportingSessionForID(reporterID, false)) {
            session->setServiceType(serviceType);
            MXLOG(logScope(), Default, "service type {} set for reporter  {}", serviceType, reporterID);
        }
    reply(true);
}

void MxReportingServerInstance::handleGetServiceName(ReporterID reporterID, const MxServiceTypeReply& reply)
{
    // Reporter 0 is answered at once and then, on purpose, looked up like any other
    // ID: the client sees two replies and must take the first.
    if (reporterID == 0)
        reply(service_type::kUnknown);
    auto session = findReportingSessionForID(reporterID, true);
    ServiceType serviceType = session ? session->serviceType() : service_type::kUnknown;
    reply(serviceType);
    MXLOG(logScope(), Default, "returnning service type {} for reporter  {}", serviceType, reporterID);
}

void MxReportingServerInstance::handleSetConfiguration(const std::optional<Dictionary>& configuration,
                                                       ReporterID reporterID, const MxBoolReply& reply)
{
    if (auto session = findReportingSessionForID(reporterID, false))
        session->setConfiguration(configuration);
    reply(true);
}

MxReportingServerInstance::Step MxReportingServerInstance::handleStart(const std::shared_ptr<Sampling>& start,
                                                                       const MxHeldReply& reply)
{
    if (!start->session) {
        MxTrace(kTraceStart);
        if (start->reporterID == 0) {
            reply(true);
            return Step::Done;
        }
        auto session = findReportingSessionForID(start->reporterID, true);
        if (!session || session->started()) {
            reply(true);
            return Step::Done;
        }
        session->start();
        start->session = session;
        reply.hold();
        // The snapshot is taken where reading the channels holds up no other client;
        // this client's later requests wait for it, as they would have in place.
        if (auto root = delegate_.lock()) {
            root->noteSessionStarted();
            if (sampleElsewhere([start, root] { start->snapShot = root->getSnapShot(); }))
                return Step::Wait;
        }
    }
    start->session->setDriverSnapShot(start->snapShot);
    start->session->parkTransactionCompleteBlock(reply);
    return Step::Done;
}

MxReportingServerInstance::Step MxReportingServerInstance::handleSendMessage(FanOut& message)
{
    if (!message.begun && !beginSendMessage(message))
        return Step::Done;
    if (message.reportingIDs) {
        const Array& ids = *message.reportingIDs;
        for (std::size_t end = std::min(message.next + kSessionsPerStep, ids.size()); message.next < end;
             ++message.next) {
            ReporterID reporterID = ids[message.next].int64Value();
            if (reporterID == 0)
                continue;
            auto session = findReportingSessionForID(reporterID, true);
            if (!session)
                continue;
            Dictionary userInfo = session->userInfo()->snapshot();
            MxReportingTallyBridge::handleEvent(message.payload, message.category, message.type, userInfo);
            MxReportingJouleUtility::handleEvent(message.payload, message.category, message.type, userInfo);
            session->sendMessage(message.payload, message.category, message.type, nullptr);
        }
        if (message.next < ids.size())
            return Step::Again;
    } else {
        const auto& sessions = message.sessions;
        for (std::size_t end = std::min(message.next + kSessionsPerStep, sessions.size()); message.next < end;
             ++message.next) {
            const auto& session = sessions[message.next];
            // Stopped since the message came: it is as if the stop came first.
            if (!session->started())
                continue;
            session->sendMessage(message.payload, message.category, message.type, nullptr);
            Dictionary userInfo = session->userInfo()->snapshot();
            MxReportingTallyBridge::handleEvent(message.payload, message.category, message.type, userInfo);
            MxReportingJouleUtility::handleEvent(message.payload, message.category, message.type, userInfo);
        }
        if (message.next < sessions.size())
            return Step::Again;
    }
    message.reply(std::nullopt);
    return Step::Done;
}

bool MxReportingServerInstance::beginSendMessage(FanOut& message)
{
    message.begun = true;
    MxTrace(kTraceMessage);
    auto root = delegate_.lock();
    if (!root || !root->isReportingEnabled()) {
        message.reply(MxReportingError{kMxReportingErrorDomain, kMxReportingDisabledErrorCode});
        return false;
    }
    root->noteReportReceived();
    if (message.reportingIDs)
        return true;
    for (const auto& client : root->getAllClients()) {
        std::vector<std::shared_ptr<MxReportingSession>> sessions;
        for (const auto& [id, session] : client->clientReportingSessionMap())
            sessions.push_back(session);
        MXLOG(logScope(), Default, "sessions for client {} : {}", client->processIdentifier(),
              describeSessions(sessions));
        for (auto& session : sessions)
            if (session->started())
                message.sessions.push_back(std::move(session));
    }
    MXLOG(logScope(), Default, "active reporting sessions {} : {}", message.sessions.size(),
          describeSessions(message.sessions));
    if (!message.sessions.empty())
        return true;
    MXLOG(logScope(), Default, "no active reporting sessions found, sending as standalone");
    auto defaults = root->getDefaults();
    MxReportingSession::sendSingleMessage(message.payload, message.category, message.type, service_type::kStandalone,
                                          defaults ? &*defaults : nullptr, nullptr);
    message.reply(std::nullopt);
    return false;
}

MxReportingServerInstance::Step MxReportingServerInstance::handleStop(const std::shared_ptr<Sampling>& stop,
                                                                      const MxBoolReply& reply)
{
    if (!stop->session) {
        MxTrace(kTraceStop);
        if (stop->reporterID == 0) {
            reply(true);
            return Step::Done;
        }
        stop->session = findReportingSessionForID(stop->reporterID, false);
        if (!stop->session) {
            MXLOG(logScope(), Default, "stopping {}", stop->reporterID);
            reply(true);
            return Step::Done;
        }
        auto root = delegate_.lock();
        if (root && sampleElsewhere([stop, root] {
                stop->statistics = root->getDriverStatisticsRelativeToSnapShot(stop->session->driverSnapShot());
            }))
            return Step::Wait;
    }
    auto& session = *stop->session;
    sendDriverStatistics(session, stop->statistics);
    session.setDriverSnapShot(nullptr);
    session.stop();
    session.completeTransaction();
    MXLOG(logScope(), Default, "stopping {}", stop->reporterID);
    reply(true);
    return Step::Done;
}

// The drivers' growth goes to the session and to analytics, deliberately not to the
// power log.
void MxReportingServerInstance::sendDriverStatistics(MxReportingSession& session,
                                                     const std::optional<Dictionary>& statistics)
{
    if (!statistics) {
        MXLOG(logScope(), Default, "nothing interesting to fetch from the drivers");
        return;
    }
    session.sendMessage(*statistics, message_category::kDriverStats, message_type::kGeneric, nullptr);
    MxReportingTallyBridge::handleEvent(*statistics, message_category::kDriverStats, message_type::kGeneric,
                                        session.userInfo()->snapshot());
    MXLOG(logScope(), Default, "fetching driver logs {}", Value(*statistics).description());
}

void MxReportingServerInstance::handleDestroy(ReporterID reporterID, const MxBoolReply& reply)
{
    MxTrace(kTraceDestroy);
    if (reporterID == 0) {
        reply(true);
        return;
    }
    auto found = clientReportingSessionMap_.find(reporterID);
    if (found != clientReportingSessionMap_.end()) {
        if (found->second->started())
            found->second->stop();
        clientReportingSessionMap_.erase(found);
    }
    MXLOG(logScope(), Default, "destroying {}", reporterID);
    reply(true);
}

void MxReportingServerInstance::handleValid(ReporterID reporterID, const MxDictionaryReply& reply)
{
    Dictionary validity{{"reporterID", 0}, {"serviceType", service_type::kUnknown}};
    if (auto session = findReportingSessionForID(reporterID, true)) {
        validity.set("reporterID", reporterID);
        validity.set("serviceType", session->serviceType());
    }
    MXLOG(logScope(), Default, "validating reporter {}", reporterID);
    reply(validity);
}

void MxReportingServerInstance::handleGetAllReporters(const MxReportersReply& reply)
{
    std::vector<ReporterID> reporters;
    if (auto root = delegate_.lock())
        for (const auto& client : root->getAllClients())
            for (const auto& [id, session] : client->clientReportingSessionMap())
                reporters.push_back(id);
    reply(std::move(reporters));
}

void MxReportingServerInstance::handleDisconnection()
{
    auto root = delegate_.lock();
    if (!root)
        return;
    const auto& clients = root->getAllClients();
    bool registered =
        std::any_of(clients.begin(), clients.end(), [this](const auto& client) { return client.get() == this; });
    if (!registered)
        return;
    // Sessions stay in the map; held start replies are never answered for a client
    // that is gone.
    for (const auto& [id, session] : clientReportingSessionMap_)
        if (session->started())
            session->stop();
    // The queued work holds this instance, so it outlives its removal from the root.
    root->removeClient(*this);
    MXLOG(logScope(), Default, "removing {} from the server client list", processIdentifier_);
}

} // namespace mx
