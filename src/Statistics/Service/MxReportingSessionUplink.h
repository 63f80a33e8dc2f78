#pragma once
// A session's side of the reporting backend: its backend session and token, and the
// work of its serial uplink queue, in submission order: backend configuration with the
// discovery wait, in-session deliveries, the flush. Only the server queue gives that
// work, and none of it blocks: so while nothing is waiting, a delivery or a flush runs
// at once, in place, on the server queue (a delivery's row is then kept, SqliteStore,
// before the report is answered). A start's configuration is queued, as it always was:
// configuration merged into the session before it runs still reaches the backend.
// Discovery suspends the queue instead of holding a thread. Jobs given meanwhile wait
// in order behind, and run on the uplink queue once the queue goes on. Order is
// submission order, always.
// Owned by its MxReportingSession. A waiting job does not hold the session: whatever
// will run it does (the queued configuration, the suspended wait), so that work
// dropped unrun leaves no session behind. Also sends single messages, which go alone
// from the global utility queue.

#include <atomic>
#include <chrono>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "Statistics/MxAtomicProperty.h"
#include "Statistics/MxLockedDictionary.h"
#include "Statistics/MxReportingVocabulary.h"
#include "platform/UniqueFunction.h"
#include "platform/Uplink.h"
#include "platform/WorkQueue.h"
#include "value/Value.h"

namespace mx {

class MxReportingSessionUplink {
public:
    using SendReply = UniqueFunction<void(std::optional<UplinkError>)>;
    // What a job says as it returns: done, or the queue waits until the job itself
    // calls resume() (on the uplink queue).
    enum class JobEnd { Done, Suspended };
    using Job = UniqueFunction<JobEnd()>;

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

    // A message on its way to the backend.
    struct Delivery {
        Dictionary cleaned;
        Dictionary message;
        bool wasStarted = false;
        MessageCategory category = 0;
        MessageType type = 0;
    };

    explicit MxReportingSessionUplink(ReporterID reporterID);
    MxReportingSessionUplink(const MxReportingSessionUplink&) = delete;
    MxReportingSessionUplink& operator=(const MxReportingSessionUplink&) = delete;

    const std::shared_ptr<WorkQueue>& queue() const { return queue_; }

    // Any thread.
    bool uplinkSessionStarted() const { return uplinkSessionStarted_.load(); }
    std::shared_ptr<UplinkSession> uplinkSession() const { return uplinkSession_.get(); }
    std::optional<UplinkSecureHierarchyToken> uplinkAgentToken() const { return uplinkAgentToken_.get(); }

    // Server queue only. Runs `job` in place, now, when no job is waiting or running:
    // true, and it ran. Else false, and the caller hands it, with what it carries
    // while it waits, to runLater.
    template <class F>
    bool runNow(F& job)
    {
        {
            std::lock_guard lock(jobsMutex_);
            if (busy_)
                return false;
            busy_ = true;
        }
        if (job() == JobEnd::Done)
            runWaiting();
        return true;
    }
    // Server queue only. Runs `job` after every job given before it.
    void runLater(Job job);
    // Server queue only. Runs `job` on the uplink queue, after every job given before
    // it; `owner` is held until the queue has gone past it.
    void runOnQueue(Job job, std::shared_ptr<void> owner);
    // The job that suspended the queue is done: the jobs behind it run, on the
    // calling thread (the uplink queue).
    void resume() { runWaiting(); }

    // Jobs only. `currentType` is the session's service type as the job runs.
    void deliver(ServiceType currentType, const Delivery& delivery, const MxLockedDictionary& userInfo);
    // Suspends the queue while discovery waits: then `resume` follows once it ended,
    // holding `owner` until then.
    JobEnd configure(ServiceType currentType, const Configuration& configuration, std::shared_ptr<void> owner);
    void flush(ServiceType currentType);

    // One message with a throw-away backend session of its own, sent from the global
    // utility queue ("alarms" after a random delay of up to 59 seconds). `userInfo`
    // is accepted and ignored. `reply`, when given, gets the backend's error or nothing.
    static void sendSingleMessage(const Dictionary& message, MessageCategory category, MessageType type,
                                  ServiceType serviceType, const Dictionary* userInfo, SendReply reply);

private:
    // Runs jobs from the front until none is left or one suspends the queue.
    void runWaiting();

    const ReporterID reporterID_;
    const std::shared_ptr<WorkQueue> queue_;
    // Written by jobs only; read from anywhere.
    std::atomic<bool> uplinkSessionStarted_{false};
    MxAtomicProperty<std::shared_ptr<UplinkSession>> uplinkSession_;
    MxAtomicProperty<std::optional<UplinkSecureHierarchyToken>> uplinkAgentToken_;
    std::mutex jobsMutex_;
    std::deque<Job> waiting_;
    bool busy_ = false; // a job runs, or the queue is suspended, or jobs wait
};

} // namespace mx
