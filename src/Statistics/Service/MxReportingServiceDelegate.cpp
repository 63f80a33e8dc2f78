#include "Statistics/Service/MxReportingServiceDelegate.h"

#include <cassert>
#include <cmath>

#include "Statistics/Service/MxReportingRequestDispatch.h"
#include "platform/MxLog.h"
#include "platform/Tally.h"

namespace mx {

namespace {

Date now() { return std::chrono::system_clock::now(); }

} // namespace

std::shared_ptr<MxReportingServiceDelegate> MxReportingServiceDelegate::make(Preferences& preferences,
                                                                             Notifications& notifications,
                                                                             ProcessTable& processTable,
                                                                             Chanstat& chanstat)
{
    std::shared_ptr<MxReportingServiceDelegate> root(
        new MxReportingServiceDelegate(preferences, notifications, processTable));
    root->listenForDefaultsNotification();
    root->driverUtility_ = std::make_unique<MxReportingDriverUtility>(chanstat);
    return root;
}

MxReportingServiceDelegate::MxReportingServiceDelegate(Preferences& preferences, Notifications& notifications,
                                                       ProcessTable& processTable)
    : preferences_(preferences),
      notifications_(notifications),
      processTable_(processTable),
      serverQueue_(ProcessWide<Dispatch>::get().makeSerialQueue("com.kestrel.harmonia.reporting.server",
                                                                QueuePriority::UserInteractive))
{
    MxReportingServerInstance::logScope();
}

bool MxReportingServiceDelegate::shouldAcceptNewConnection(ServiceListener&,
                                                           std::shared_ptr<ServiceConnection> connection)
{
    pid_t pid = connection->processIdentifier();
    Date accepted = now();
    MXLOG(MxReportingServerInstance::logScope(), Default, "newConnection: {}", connection->description());

    std::shared_ptr<MxReportingServerInstance> client;
    {
        std::lock_guard lock(lock_);
        client = std::make_shared<MxReportingServerInstance>(pid, weak_from_this(), serverQueue_);
        connection->setExportedObject(std::make_shared<MxReportingRequestDispatch>(
            client,
            [weakSelf = weak_from_this()](std::function<void(Dictionary)> reply) {
                if (auto self = weakSelf.lock())
                    self->requestStatus(std::move(reply));
            },
            client->backlog()));
    }

    // Requests of the new client queue up behind its registration.
    std::weak_ptr<MxReportingServerInstance> weakClient = client;
    serverQueue_->dispatch([self = shared_from_this(), weakClient, pid, accepted] {
        if (auto live = weakClient.lock())
            self->registerClient(live, pid, accepted);
    });

    connection->setInterruptionHandler([weakClient] {
        MXLOG(MxReportingServerInstance::logScope(), Default, "InterruptionHandler: connection exited");
        if (auto live = weakClient.lock())
            live->handleConnectionError();
    });
    connection->setInvalidationHandler([weakSelf = weak_from_this(), weakClient, pid] {
        if (auto self = weakSelf.lock())
            self->reportClientUptime(weakClient, pid);
    });
    connection->resume();
    return true;
}

void MxReportingServiceDelegate::registerClient(const std::shared_ptr<MxReportingServerInstance>& client, pid_t pid,
                                                Date accepted)
{
    clients_.push_back(client);
    client->setClientStartDate(accepted);
    if (pid == processTable_.ownProcessIdentifier())
        client->setClientProcessName(processTable_.ownProcessName());
    else if (pid >= 1)
        client->setClientProcessName(processTable_.processName(pid));
}

void MxReportingServiceDelegate::reportClientUptime(const std::weak_ptr<MxReportingServerInstance>& weakClient,
                                                    pid_t pid)
{
    const MxLogScope* scope = MxReportingServerInstance::logScope();
    auto client = weakClient.lock();
    if (client)
        client->handleConnectionError();

    Date ended = now();
    Value seconds = -1;
    auto startDate = client ? client->clientStartDate() : std::nullopt;
    auto processName = client ? client->clientProcessName() : std::nullopt;
    if (!startDate) {
        MXLOG(scope, Default, "clientStartDate is nil. clientpid={} clientprocessname={}", pid,
              processName.value_or("unknown"));
    } else {
        auto span = std::chrono::duration<double>(ended > *startDate ? ended - *startDate : *startDate - ended);
        seconds = span.count();
        // Worded so on purpose, although the date lies in the future.
        if (*startDate > ended)
            MXLOG(scope, Default, "clientStartDate is in the past. clientpid={} clientprocessname={}", pid,
                  processName.value_or("unknown"));
    }
    MXLOG(scope, Default, "InvalidationHandler: connection exited process={} uptime_sec={}",
          processName.value_or("(null)"), static_cast<int>(seconds.doubleValue()));

    if (!processName) {
        MXLOG(scope, Default, "clientProcessName is nil. clientpid={}", pid);
        return;
    }
    TallySendEventLazy("com.kestrel.harmonia.mxreportingclientuptime", [name = *processName, seconds] {
        return Dictionary{{"processName", name}, {"seconds", seconds}};
    });
}

std::optional<Dictionary> MxReportingServiceDelegate::getDefaults() { return defaults_; }

const std::vector<std::shared_ptr<MxReportingServerInstance>>& MxReportingServiceDelegate::getAllClients()
{
    assert(serverQueue_->isCurrent());
    return clients_;
}

std::shared_ptr<MxReportingSession> MxReportingServiceDelegate::findReportingSessionForID(ReporterID reporterID)
{
    std::lock_guard lock(lock_);
    if (reporterID == 0 || !reportingEnabled_.load())
        return nullptr;
    const MxReportingServerInstance* owner = nullptr;
    if (auto session = sessionOfAnyClient(reporterID, owner)) {
        MXLOG(MxReportingServerInstance::logScope(), Info, "found reporting session {} for client {}", reporterID,
              owner->processIdentifier());
        return session;
    }
    MXLOG(MxReportingServerInstance::logScope(), Error, "failed to find reporting session {}", reporterID);
    return nullptr;
}

std::shared_ptr<MxReportingSession> MxReportingServiceDelegate::lookUpSession(ReporterID reporterID)
{
    std::lock_guard lock(lock_);
    if (reporterID == 0 || !reportingEnabled_.load())
        return nullptr;
    const MxReportingServerInstance* owner = nullptr;
    return sessionOfAnyClient(reporterID, owner);
}

std::shared_ptr<MxReportingSession> MxReportingServiceDelegate::sessionOfAnyClient(
    ReporterID reporterID, const MxReportingServerInstance*& owner) const
{
    for (const auto& client : clients_) {
        const auto& sessions = client->clientReportingSessionMap();
        if (auto found = sessions.find(reporterID); found != sessions.end()) {
            owner = client.get();
            return found->second;
        }
    }
    return nullptr;
}

std::size_t MxReportingServiceDelegate::sessionsHeld()
{
    assert(serverQueue_->isCurrent());
    std::size_t held = 0;
    for (const auto& client : clients_)
        held += client->clientReportingSessionMap().size();
    return held;
}

std::size_t MxReportingServiceDelegate::keptBytesInService() { return MxReportingSession::keptBytesInService(); }

std::shared_ptr<MxReportingDriverSnapShot> MxReportingServiceDelegate::getSnapShot()
{
    return std::make_shared<MxReportingDriverSnapShot>(driverUtility_->getSnapShot());
}

std::optional<Dictionary> MxReportingServiceDelegate::getDriverStatisticsRelativeToSnapShot(
    const std::shared_ptr<MxReportingDriverSnapShot>& snapShot)
{
    return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapShot.get());
}

Array MxReportingServiceDelegate::clientsStatus() const
{
    std::vector<Value> clients;
    for (const auto& client : clients_)
        clients.emplace_back(Dictionary{{"pid", client->processIdentifier()},
                                        {"process", client->clientProcessName().value_or("")},
                                        {"sessions", client->clientReportingSessionMap().size()},
                                        {"backlog_bytes", client->backlog()->owed()},
                                        {"held_back", client->backlog()->overdrawn()}});
    return Array(std::move(clients));
}

void MxReportingServiceDelegate::requestStatus(std::function<void(Dictionary)> reply)
{
    serverQueue_->dispatch([self = shared_from_this(), reply = std::move(reply)] {
        reply(self->statusView_ ? self->statusView_() : Dictionary{});
    });
}

void MxReportingServiceDelegate::removeClient(const MxReportingServerInstance& client)
{
    std::erase_if(clients_, [&](const auto& candidate) { return candidate.get() == &client; });
}

Dictionary MxReportingServiceDelegate::MxReportingDefaults()
{
    Dictionary stored = preferences_.copyDomain(kMxReportingDefaultsDomain);
    Dictionary defaults;
    if (const Value* deviceName = stored.find("device_name"); deviceName && deviceName->asString())
        defaults.set("device_name", *deviceName);
    const Value* disable = stored.find("disable_reporting");
    defaults.set("disable_reporting", disable ? std::int64_t(disable->boolValue()) : std::int64_t(0));
    return defaults;
}

void MxReportingServiceDelegate::listenForDefaultsNotification()
{
    std::uint32_t status = notifications_.registerDispatch(kMxReportingDefaultsNotification, notifyToken_, serverQueue_,
                                                           [weakSelf = weak_from_this()](int token) {
                                                               if (auto self = weakSelf.lock())
                                                                   self->handleDefaultsNotification(token);
                                                           });
    MXLOG(MxReportingServerInstance::logScope(), Default, "notify setup result {}", status);
}

void MxReportingServiceDelegate::handleDefaultsNotification(int token)
{
    if (token != notifyToken_)
        return;
    const MxLogScope* scope = MxReportingServerInstance::logScope();
    MXLOG(scope, Default, "re-reading harmonia defaults");
    defaults_ = MxReportingDefaults();
    MXLOG(scope, Info, "defaults {}", Value(*defaults_).description());
    for (const auto& client : clients_)
        for (const auto& [id, session] : client->clientReportingSessionMap())
            session->updateDefaults(defaults_);
    if (const Value* disable = defaults_->find("disable_reporting"))
        reportingEnabled_.store(!disable->boolValue());
}

} // namespace mx
