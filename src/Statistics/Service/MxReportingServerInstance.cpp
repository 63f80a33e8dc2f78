#include "Statistics/Service/MxReportingServerInstance.h"

#include <algorithm>
#include <cassert>
#include <cstdlib>

#include <fmt/format.h>

#include "Statistics/MxReportingJouleUtility.h"
#include "Statistics/MxReportingTallyBridge.h"
#include "platform/ReplyGate.h"
#include "platform/TracePoints.h"

namespace mx {

namespace {

constexpr std::uint32_t kTraceCreate = 0x21042814;
constexpr std::uint32_t kTraceStart = 0x21042818;
constexpr std::uint32_t kTraceStop = 0x2104281C;
constexpr std::uint32_t kTraceDestroy = 0x21042820;
constexpr std::uint32_t kTraceMessage = 0x21042824;

constexpr int kKillServiceExitStatus = 2;

// The sessions a message reaches, in a log line: every one of them, as the listing
// of a client's sessions gives them.
std::string describeSessions(const std::vector<std::shared_ptr<MxReportingSession>>& sessions)
{
    std::string text = "(";
    for (std::size_t i = 0; i < sessions.size(); ++i) {
        text += i == 0 ? "" : ", ";
        text += sessions[i]->description();
    }
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

// A message on its way to its sessions.
struct MxReportingServerInstance::FanOut {
    Dictionary payload;
    MessageCategory category;
    MessageType type;
    std::optional<Array> reportingIDs;
    MxErrorReply reply;
};

// The work holds the endpoint weakly: one that is gone before its request runs leaves
// nothing to do, and nobody to answer.
template <class Work>
void MxReportingServerInstance::enqueue(Work work, std::size_t weight)
{
    serverQueue_->dispatch([weakSelf = weak_from_this(), work = std::move(work), weight]() mutable {
        auto self = weakSelf.lock();
        if (!self)
            return;
        ScopedBacklogAccount charging(self->backlog_, weight);
        work(*self);
    });
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

const std::string& MxReportingServerInstance::sessionListing()
{
    assert(serverQueue_->isCurrent());
    if (!sessionListing_) {
        std::vector<std::shared_ptr<MxReportingSession>> sessions;
        sessions.reserve(clientReportingSessionMap_.size());
        for (const auto& [id, session] : clientReportingSessionMap_)
            sessions.push_back(session);
        sessionListing_ = describeSessions(sessions);
    }
    return *sessionListing_;
}

void MxReportingServerInstance::sessionChanged(ReporterID reporterID, const MxReportingSession& session)
{
    assert(serverQueue_->isCurrent());
    auto held = clientReportingSessionMap_.find(reporterID);
    // A session replaced under its ID, or destroyed, is no longer this client's.
    if (held == clientReportingSessionMap_.end() || held->second.get() != &session)
        return;
    sessionListing_.reset();
    if (session.started())
        startedSessions_[reporterID] = held->second;
    else
        startedSessions_.erase(reporterID);
}

void MxReportingServerInstance::forgetSession(ReporterID reporterID)
{
    startedSessions_.erase(reporterID);
    sessionListing_.reset();
}

// ---- Entry points: connection layer threads. Log and queue, nothing else.

void MxReportingServerInstance::createReportingSession(ReporterID reporterID, MxCreateReply reply)
{
    MXLOG_VERBOSE(logScope(), "creating session for reporter {}", reporterID);
    enqueue([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleCreate(reporterID, reply);
    });
}

void MxReportingServerInstance::setServiceType(ServiceType serviceType, ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "setting service type {} for reporter {}", serviceType, reporterID);
    enqueue([serviceType, reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleSetServiceType(serviceType, reporterID, reply);
    });
}

void MxReportingServerInstance::getServiceNameForReporterID(ReporterID reporterID, MxServiceTypeReply reply)
{
    // Intended: the log texts of this endpoint keep their spelling ("seviceType",
    // "returnning", the doubled space), which log searches rely on.
    MXLOG_VERBOSE(logScope(), "fetching seviceType");
    enqueue([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleGetServiceName(reporterID, reply);
    });
}

void MxReportingServerInstance::setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                                                 MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "setting configuration");
    enqueue([configuration = std::move(configuration), reporterID, reply = std::move(reply)](
                MxReportingServerInstance& self) { self.handleSetConfiguration(configuration, reporterID, reply); });
}

void MxReportingServerInstance::startReportingSessionForID(ReporterID reporterID, MxHeldReply reply)
{
    MXLOG_VERBOSE(logScope(), "starting session for reporter {}", reporterID);
    enqueue([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleStart(reporterID, reply);
    });
}

void MxReportingServerInstance::sendMessage(Dictionary payload, MessageCategory category, MessageType type,
                                            std::optional<Array> reportingIDs, MxErrorReply reply)
{
    MXLOG_VERBOSE(logScope(), "sending message for reporter {}",
                  reportingIDs ? Value(*reportingIDs).description() : std::string("(null)"));
    // What each row and delivery it leaves behind is charged: the payload they share.
    std::size_t weight = approximateBytes(Value(payload));
    enqueue([message = FanOut{std::move(payload), category, type, std::move(reportingIDs), std::move(reply)}](
                MxReportingServerInstance& self) mutable { self.handleSendMessage(message); },
            weight);
}

void MxReportingServerInstance::stopReportingSessionForID(ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "stopping session for reporter {}", reporterID);
    enqueue([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleStop(reporterID, reply);
    });
}

void MxReportingServerInstance::destroyReportingSession(ReporterID reporterID, MxBoolReply reply)
{
    MXLOG_VERBOSE(logScope(), "destroying session for reporter {}", reporterID);
    enqueue([reporterID, reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleDestroy(reporterID, reply);
    });
}

void MxReportingServerInstance::reporterID(ReporterID reporterID, MxDictionaryReply valid)
{
    MXLOG_VERBOSE(logScope(), "validating reporter {}", reporterID);
    enqueue([reporterID, valid = std::move(valid)](MxReportingServerInstance& self) {
        self.handleValid(reporterID, valid);
    });
}

void MxReportingServerInstance::getAllReporters(MxReportersReply reply)
{
    enqueue([reply = std::move(reply)](MxReportingServerInstance& self) { self.handleGetAllReporters(reply); });
}

void MxReportingServerInstance::killService(MxBoolReply)
{
    MXLOG(logScope(), Default, "DESTROYING SERVICE");
    std::_Exit(kKillServiceExitStatus);
}

void MxReportingServerInstance::handleConnectionError()
{
    enqueue([](MxReportingServerInstance& self) { self.handleDisconnection(); });
}

// ---- Work: server queue.

void MxReportingServerInstance::handleCreate(ReporterID reporterID, const MxCreateReply& reply)
{
    MxTrace(kTraceCreate);
    // A session made anew under an ID this client holds replaces it: it counts against
    // no limit.
    if (!clientReportingSessionMap_.contains(reporterID)) {
        auto root = delegate_.lock();
        std::optional<std::string> limit;
        if (clientReportingSessionMap_.size() >= kMaximumSessions)
            limit = fmt::format("too many sessions on this connection ({})", kMaximumSessions);
        else if (root && root->sessionsHeld() >= kMaximumSessionsInService)
            limit = fmt::format("too many sessions in the service ({})", kMaximumSessionsInService);
        if (limit) {
            MXLOG_LIMITED(logScope(), Error, "no session made for reporter {} of client pid {}: {}", reporterID,
                          processIdentifier_, *limit);
            reply.refuse(*limit);
            return;
        }
    }
    auto session = std::make_shared<MxReportingSession>(reporterID, std::vector<std::int32_t>{processIdentifier_});
    session->setChangeObserver([weakSelf = weak_from_this(), reporterID](const MxReportingSession& changed) {
        if (auto self = weakSelf.lock())
            self->sessionChanged(reporterID, changed);
    });
    forgetSession(reporterID);
    clientReportingSessionMap_[reporterID] = std::move(session);
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

void MxReportingServerInstance::handleStart(ReporterID reporterID, const MxHeldReply& reply)
{
    MxTrace(kTraceStart);
    if (reporterID == 0) {
        reply(true);
        return;
    }
    auto session = findReportingSessionForID(reporterID, true);
    if (!session || session->started()) {
        reply(true);
        return;
    }
    session->start();
    if (auto root = delegate_.lock()) {
        root->noteSessionStarted();
        session->setDriverSnapShot(root->getSnapShot());
    }
    reply.hold();
    session->parkTransactionCompleteBlock(reply);
}

void MxReportingServerInstance::handleSendMessage(FanOut& message)
{
    MxTrace(kTraceMessage);
    auto root = delegate_.lock();
    if (!root || !root->isReportingEnabled()) {
        message.reply(MxReportingError{kMxReportingErrorDomain, kMxReportingDisabledErrorCode});
        return;
    }
    // Looked at before anything is done, without a trace in the log: a message past a
    // limit is refused whole.
    if (auto limit = keepingLimit(message, sessionsKeeping(message, *root), *root)) {
        MXLOG_LIMITED(logScope(), Error, "message of client pid {} refused: {}", processIdentifier_, *limit);
        message.reply.refuse(*limit);
        return;
    }
    root->noteReportReceived();
    // The reply says the message was taken: it goes once everything the message left
    // is kept, which is at once unless a row found no room or a delivery waits.
    ScopedReplyGate replyOnceKept([reply = std::move(message.reply)] { reply(std::nullopt); });
    if (message.reportingIDs)
        sendToListedSessions(message);
    else
        sendToStartedSessions(message, *root);
}

void MxReportingServerInstance::sendToListedSessions(const FanOut& message)
{
    // Every ID in its order, repeats too; unknown ones and 0 reach nobody.
    for (const auto& id : *message.reportingIDs) {
        ReporterID reporterID = id.int64Value();
        if (reporterID == 0)
            continue;
        auto session = findReportingSessionForID(reporterID, true);
        if (!session)
            continue;
        // The session comes last here, first for a message without an ID list: both
        // orders are intended.
        Dictionary userInfo = session->userInfo()->snapshot();
        MxReportingTallyBridge::handleEvent(message.payload, message.category, message.type, userInfo);
        MxReportingJouleUtility::handleEvent(message.payload, message.category, message.type, userInfo);
        session->sendMessage(message.payload, message.category, message.type, nullptr);
    }
}

void MxReportingServerInstance::sendToStartedSessions(const FanOut& message, MxReportingServiceDelegateProtocol& root)
{
    std::vector<std::shared_ptr<MxReportingSession>> sessions;
    for (const auto& client : root.getAllClients()) {
        MXLOG(logScope(), Default, "sessions for client {} : {}", client->processIdentifier(),
              client->sessionListing());
        for (const auto& [id, session] : client->startedSessions())
            sessions.push_back(session);
    }
    MXLOG(logScope(), Default, "active reporting sessions {} : {}", sessions.size(), describeSessions(sessions));
    if (sessions.empty()) {
        MXLOG(logScope(), Default, "no active reporting sessions found, sending as standalone");
        auto defaults = root.getDefaults();
        MxReportingSession::sendSingleMessage(message.payload, message.category, message.type,
                                              service_type::kStandalone, defaults ? &*defaults : nullptr, nullptr);
        return;
    }
    for (const auto& session : sessions) {
        session->sendMessage(message.payload, message.category, message.type, nullptr);
        Dictionary userInfo = session->userInfo()->snapshot();
        MxReportingTallyBridge::handleEvent(message.payload, message.category, message.type, userInfo);
        MxReportingJouleUtility::handleEvent(message.payload, message.category, message.type, userInfo);
    }
}

std::vector<std::shared_ptr<MxReportingSession>> MxReportingServerInstance::sessionsKeeping(
    const FanOut& message, MxReportingServiceDelegateProtocol& root) const
{
    std::vector<std::shared_ptr<MxReportingSession>> sessions;
    auto keep = [&](std::shared_ptr<MxReportingSession> session) {
        if (session && session->keptBytes())
            sessions.push_back(std::move(session));
    };
    if (!message.reportingIDs) {
        for (const auto& client : root.getAllClients())
            for (const auto& [id, session] : client->startedSessions())
                keep(session);
        return sessions;
    }
    for (const auto& id : *message.reportingIDs) {
        ReporterID reporterID = id.int64Value();
        if (reporterID == 0)
            continue;
        auto own = clientReportingSessionMap_.find(reporterID);
        keep(own != clientReportingSessionMap_.end() ? own->second : root.lookUpSession(reporterID));
    }
    return sessions;
}

std::optional<std::string> MxReportingServerInstance::keepingLimit(
    const FanOut& message, const std::vector<std::shared_ptr<MxReportingSession>>& sessions,
    MxReportingServiceDelegateProtocol& root)
{
    if (sessions.empty())
        return std::nullopt;
    std::size_t bytes = MxReportingSession::keptBytesOf(message.payload);
    std::map<const MxReportingSession*, std::size_t> added;
    std::size_t total = 0;
    for (const auto& session : sessions) {
        std::size_t& more = added[session.get()];
        more += bytes;
        total += bytes;
        if (session->keptBytes().value_or(0) + more > MxReportingSession::kMaximumKeptBytes)
            return fmt::format("the session keeps too much: reporter {} would pass {} MiB this period",
                               session->reporterID(), MxReportingSession::kMaximumKeptBytes >> 20);
    }
    if (root.keptBytesInService() + total > MxReportingSession::kMaximumKeptBytesInService)
        return fmt::format("the session keeps too much: the service would pass {} MiB kept in all",
                           MxReportingSession::kMaximumKeptBytesInService >> 20);
    return std::nullopt;
}

void MxReportingServerInstance::handleStop(ReporterID reporterID, const MxBoolReply& reply)
{
    MxTrace(kTraceStop);
    if (reporterID == 0) {
        reply(true);
        return;
    }
    if (auto session = findReportingSessionForID(reporterID, false)) {
        auto root = delegate_.lock();
        auto statistics = root ? root->getDriverStatisticsRelativeToSnapShot(session->driverSnapShot()) : std::nullopt;
        sendDriverStatistics(*session, statistics);
        session->setDriverSnapShot(nullptr);
        session->stop();
        session->completeTransaction();
    }
    MXLOG(logScope(), Default, "stopping {}", reporterID);
    reply(true);
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
        auto session = found->second;
        if (session->started())
            session->stop();
        clientReportingSessionMap_.erase(found);
        forgetSession(reporterID);
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
