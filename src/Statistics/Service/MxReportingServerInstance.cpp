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

// Work posted from a connection holds the endpoint weakly: an endpoint that
// is gone before its request runs leaves nothing to do, and nobody to answer.
template <class Work>
void MxReportingServerInstance::enqueue(Work work)
{
    serverQueue_->dispatch([weakSelf = weak_from_this(), work = std::move(work)]() mutable {
        if (auto self = weakSelf.lock())
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

// ---- Entry points: connection layer threads. Log and queue, nothing else.

void MxReportingServerInstance::createReportingSession(ReporterID reporterID, MxBoolReply reply)
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
    enqueue([payload = std::move(payload), category, type, reportingIDs = std::move(reportingIDs),
             reply = std::move(reply)](MxReportingServerInstance& self) {
        self.handleSendMessage(payload, category, type, reportingIDs, reply);
    });
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

void MxReportingServerInstance::handleSendMessage(const Dictionary& payload, MessageCategory category, MessageType type,
                                                  const std::optional<Array>& reportingIDs, const MxErrorReply& reply)
{
    MxTrace(kTraceMessage);
    auto root = delegate_.lock();
    if (!root || !root->isReportingEnabled()) {
        reply(MxReportingError{kMxReportingErrorDomain, kMxReportingDisabledErrorCode});
        return;
    }
    root->noteReportReceived();
    if (!reportingIDs) {
        sendToStartedSessions(payload, category, type, *root);
        reply(std::nullopt);
        return;
    }
    for (const Value& element : *reportingIDs) {
        ReporterID reporterID = element.int64Value();
        if (reporterID == 0)
            continue;
        auto session = findReportingSessionForID(reporterID, true);
        if (!session)
            continue;
        Dictionary userInfo = session->userInfo()->snapshot();
        MxReportingTallyBridge::handleEvent(payload, category, type, userInfo);
        MxReportingJouleUtility::handleEvent(payload, category, type, userInfo);
        session->sendMessage(payload, category, type, nullptr);
    }
    reply(std::nullopt);
}

void MxReportingServerInstance::sendToStartedSessions(const Dictionary& payload, MessageCategory category,
                                                      MessageType type, MxReportingServiceDelegateProtocol& root)
{
    std::vector<std::shared_ptr<MxReportingSession>> active;
    for (const auto& client : root.getAllClients()) {
        std::vector<std::shared_ptr<MxReportingSession>> sessions;
        for (const auto& [id, session] : client->clientReportingSessionMap())
            sessions.push_back(session);
        MXLOG(logScope(), Default, "sessions for client {} : {}", client->processIdentifier(),
              describeSessions(sessions));
        for (auto& session : sessions)
            if (session->started())
                active.push_back(std::move(session));
    }
    MXLOG(logScope(), Default, "active reporting sessions {} : {}", active.size(), describeSessions(active));

    if (active.empty()) {
        MXLOG(logScope(), Default, "no active reporting sessions found, sending as standalone");
        auto defaults = root.getDefaults();
        MxReportingSession::sendSingleMessage(payload, category, type, service_type::kStandalone,
                                              defaults ? &*defaults : nullptr, nullptr);
        return;
    }
    for (const auto& session : active) {
        session->sendMessage(payload, category, type, nullptr);
        Dictionary userInfo = session->userInfo()->snapshot();
        MxReportingTallyBridge::handleEvent(payload, category, type, userInfo);
        MxReportingJouleUtility::handleEvent(payload, category, type, userInfo);
    }
}

void MxReportingServerInstance::handleStop(ReporterID reporterID, const MxBoolReply& reply)
{
    MxTrace(kTraceStop);
    if (reporterID == 0) {
        reply(true);
        return;
    }
    if (auto session = findReportingSessionForID(reporterID, false)) {
        sendDriverStatistics(*session);
        session->setDriverSnapShot(nullptr);
        session->stop();
        session->completeTransaction();
    }
    MXLOG(logScope(), Default, "stopping {}", reporterID);
    reply(true);
}

// The drivers' growth goes to the session and to analytics, deliberately not to the
// power log.
void MxReportingServerInstance::sendDriverStatistics(MxReportingSession& session)
{
    auto root = delegate_.lock();
    auto statistics = root ? root->getDriverStatisticsRelativeToSnapShot(session.driverSnapShot()) : std::nullopt;
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
