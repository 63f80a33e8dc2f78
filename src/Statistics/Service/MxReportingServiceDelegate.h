#pragma once
// The service root: accepts client connections and makes one endpoint per client,
// keeps the list of connected clients, answers the endpoints' cross-client
// questions, holds the reporting defaults and switch and the driver statistics
// sampler, and reports each client's connection time when it leaves. Created once by main and never destroyed.
// The client list, the defaults and the switch change only on the serial server
// queue; acceptance and the cross-client lookup also take the root's own lock.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "Statistics/Service/MxReportingServerInstance.h"
#include "Statistics/Service/MxReportingServiceDelegateProtocol.h"
#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "platform/ProcessTable.h"
#include "platform/ServiceConnection.h"
#include "platform/WorkQueue.h"

namespace mx {

inline constexpr const char* kMxReportingDefaultsDomain = "com.kestrel.harmonia";
inline constexpr const char* kMxReportingDefaultsNotification = "com.kestrel.harmonia.reporting";

class MxReportingServiceDelegate final : public MxReportingServiceDelegateProtocol,
                                         public ServiceListenerDelegate,
                                         public std::enable_shared_from_this<MxReportingServiceDelegate> {
public:
    // init: the scope, the server queue, an empty client list, reporting on, the
    // registration for the defaults notification, the driver statistics sampler
    // (which subscribes at once). Defaults are not read yet.
    static std::shared_ptr<MxReportingServiceDelegate> make(Preferences& preferences, Notifications& notifications,
                                                            ProcessTable& processTable, Chanstat& chanstat);

    const std::shared_ptr<WorkQueue>& serverQueue() const { return serverQueue_; }

    bool shouldAcceptNewConnection(ServiceListener& listener, std::shared_ptr<ServiceConnection> connection) override;

    std::optional<Dictionary> getDefaults() override;
    const std::vector<std::shared_ptr<MxReportingServerInstance>>& getAllClients() override;
    bool isReportingEnabled() override { return reportingEnabled_.load(); }
    std::shared_ptr<MxReportingSession> findReportingSessionForID(ReporterID reporterID) override;
    std::shared_ptr<MxReportingSession> lookUpSession(ReporterID reporterID) override;
    std::shared_ptr<MxReportingDriverSnapShot> getSnapShot() override;
    std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
        const std::shared_ptr<MxReportingDriverSnapShot>& snapShot) override;
    void removeClient(const MxReportingServerInstance& client) override;
    std::size_t sessionsHeld() override;
    std::size_t keptBytesInService() override;
    void noteSessionStarted() override { sessionsStarted_.fetch_add(1, std::memory_order_relaxed); }
    void noteReportReceived() override { reportsReceived_.fetch_add(1, std::memory_order_relaxed); }

    // What the status view shows of the service itself, "status" of the wire
    // answered with it. The view is set once, before the first connection.
    std::uint64_t sessionsStarted() const { return sessionsStarted_.load(std::memory_order_relaxed); }
    std::uint64_t reportsReceived() const { return reportsReceived_.load(std::memory_order_relaxed); }
    // Server queue only: {pid, process, sessions, backlog_bytes, held_back} of each
    // connected client (held back: not read until it owes less).
    Array clientsStatus() const;
    void setStatusView(std::function<Dictionary()> view) { statusView_ = std::move(view); }
    // Answers `reply` with the status view, built on the server queue.
    void requestStatus(std::function<void(Dictionary)> reply);

    // The defaults dictionary as the preferences hold it now.
    Dictionary MxReportingDefaults();

    // The invalidation handler's work: clean-up, then the client uptime event.
    void reportClientUptime(const std::weak_ptr<MxReportingServerInstance>& weakClient, pid_t pid);

private:
    MxReportingServiceDelegate(Preferences& preferences, Notifications& notifications, ProcessTable& processTable);

    void listenForDefaultsNotification();
    void handleDefaultsNotification(int token);
    void registerClient(const std::shared_ptr<MxReportingServerInstance>& client, pid_t pid, Date accepted);
    // Under the lock: the first session of that ID in connection order, and its client.
    std::shared_ptr<MxReportingSession> sessionOfAnyClient(ReporterID reporterID,
                                                           const MxReportingServerInstance*& owner) const;

    Preferences& preferences_;
    Notifications& notifications_;
    ProcessTable& processTable_;
    std::shared_ptr<WorkQueue> serverQueue_;
    // Made last at start-up, after the notification registration; read-only after.
    std::unique_ptr<MxReportingDriverUtility> driverUtility_;
    std::recursive_mutex lock_;

    std::atomic<bool> reportingEnabled_{true};
    std::atomic<std::uint64_t> sessionsStarted_{0};
    std::atomic<std::uint64_t> reportsReceived_{0};
    std::function<Dictionary()> statusView_;
    std::vector<std::shared_ptr<MxReportingServerInstance>> clients_;
    std::optional<Dictionary> defaults_;
    int notifyToken_ = 0;
};

} // namespace mx
