#pragma once
// A session's side of the reporting backend: its backend session and token, and the
// work that runs on the session's own serial uplink queue, in submission order:
// backend configuration with the discovery wait, in-session deliveries, the flush.
// A started session's delivery is made at once, on the server queue, while the uplink
// queue has nothing to do: the server queue alone gives the uplink queue work, so it
// stays idle meanwhile, and the delivery keeps its order. It then costs no hop and no
// wake-up of the utility thread, and its row is kept (SqliteStore) before the report
// is answered. Otherwise (a configuration waiting for its backends, a flush, a session
// not started) deliveries are held and go in gathered runs: a queue hop per report
// costs more than the delivery, so a run a few milliseconds after the first held one
// takes all that came since. Configuration and flush take what is held before they
// are queued, so nothing is delivered out of its order with them.
// Owned by its MxReportingSession, which queues that work holding itself, so the
// session (and this object) outlives every queued job. Also sends single messages,
// which go alone from the global utility queue.

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/MxAtomicProperty.h"
#include "Statistics/MxLockedDictionary.h"
#include "Statistics/MxReportingVocabulary.h"
#include "platform/BacklogAccount.h"
#include "platform/UniqueFunction.h"
#include "platform/Uplink.h"
#include "platform/WorkQueue.h"
#include "value/Value.h"

namespace mx {

class MxReportingSessionUplink {
public:
    using SendReply = UniqueFunction<void(std::optional<UplinkError>)>;

    // What a start hands to its configuration job, taken when the session starts.
    struct Configuration {
        // The session's live user information, not a copy: configuration merged in
        // before the job runs still reaches the backend session.
        std::shared_ptr<MxLockedDictionary> userInfo;
        std::string serviceName;
        ServiceType serviceType = service_type::kUnknown;
        // Seed of the discovery flag that the job shares with the backend's callback.
        bool discovered = false;
    };

    // A message on its way to the backend, owed by the client that sent it until it
    // is delivered.
    struct Delivery {
        Dictionary cleaned;
        Dictionary message;
        bool wasStarted = false;
        MessageCategory category = 0;
        MessageType type = 0;
        BacklogDebt debt;
    };

    // How long a run of held deliveries gathers after the first of it is held. It is
    // what a SIGKILL may take of them, for the store keeps each row it is handed
    // (SqliteStore); with the store's short window, for a row it finds no room to
    // keep, it stays under 100 ms.
    static constexpr std::chrono::milliseconds kDeliveryGathering{40};

    explicit MxReportingSessionUplink(ReporterID reporterID);
    MxReportingSessionUplink(const MxReportingSessionUplink&) = delete;
    MxReportingSessionUplink& operator=(const MxReportingSessionUplink&) = delete;

    const std::shared_ptr<WorkQueue>& queue() const { return queue_; }

    // Any thread.
    bool uplinkSessionStarted() const { return uplinkSessionStarted_.load(); }
    std::shared_ptr<UplinkSession> uplinkSession() const { return uplinkSession_.get(); }
    std::optional<UplinkSecureHierarchyToken> uplinkAgentToken() const { return uplinkAgentToken_.get(); }

    // Server queue only. Queues `job` on the uplink queue, counted until it has run.
    void run(UniqueFunction<void()> job);
    void runAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> job);
    // Server queue only. Nothing is queued on the uplink queue or running there, and
    // nothing can be until the caller returns: what it delivers now is in order.
    bool idle() const { return queuedJobs_.load(std::memory_order_acquire) == 0; }

    // Any thread. Holds the delivery for the next run; true when nothing was held
    // before it, and the caller queues that run.
    bool hold(Delivery delivery);
    // Any thread. What is held, in order, for a job about to be queued.
    std::vector<Delivery> takeHeld();

    // Uplink queue only, or the server queue while idle. `currentType` is the
    // session's service type as the delivery is made.
    void deliver(ServiceType currentType, const Delivery& delivery, const MxLockedDictionary& userInfo);
    // Uplink queue only.
    void configure(ServiceType currentType, const Configuration& configuration);
    void flush(ServiceType currentType);

    // One message with a throw-away backend session of its own, sent from the global
    // utility queue ("alarms" after a random delay of up to 59 seconds). `userInfo`
    // is accepted and ignored. `reply`, when given, gets the backend's error or nothing.
    static void sendSingleMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                  ServiceType serviceType, const Dictionary* userInfo, SendReply reply);

private:
    UniqueFunction<void()> counted(UniqueFunction<void()> job);

    const ReporterID reporterID_;
    const std::shared_ptr<WorkQueue> queue_;
    std::atomic<int> queuedJobs_{0};
    // Written on the uplink queue only; read from anywhere.
    std::atomic<bool> uplinkSessionStarted_{false};
    MxAtomicProperty<std::shared_ptr<UplinkSession>> uplinkSession_;
    MxAtomicProperty<std::optional<UplinkSecureHierarchyToken>> uplinkAgentToken_;
    std::mutex heldMutex_;
    std::vector<Delivery> held_;
};

} // namespace mx
