#pragma once
// A per-key debounce for deliveries: a message's delivery is held for the message's
// throttle time and then run on the throttle's own worker thread; a later message
// with the same key replaces the held delivery and starts its wait again, so a burst
// delivers its last message once. Shared: the worker thread holds it while it runs,
// and its owner ends it with invalidate() before letting go.
// Callers add from any thread; deliveries run one at a time on the worker, in the
// order they fall due.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>

#include "Statistics/MxAtomicProperty.h"
#include "Statistics/MxReportingVocabulary.h"
#include "value/Value.h"

namespace mx {

class MxReportingBlockThrottle : public std::enable_shared_from_this<MxReportingBlockThrottle> {
public:
    using Block = std::function<void()>;

    // init: empty, running, its worker thread started.
    static std::shared_ptr<MxReportingBlockThrottle> make();
    ~MxReportingBlockThrottle();

    // The text under which two messages count as the same: the message's keys in
    // byte order each with its value (or "^" for keys left out of the comparison),
    // then "reporterID", the ID, the category name and the type name, joined by "|".
    static std::string buildMessageKey(const Dictionary& message, ReporterID reporterID, MessageCategory category,
                                       MessageType type);
    // The message's "_throttle_seconds", 0.5 when it has none or one that is not a
    // number or whose whole part is above 4.
    static double determineSleepTime(const Dictionary& message);

    void addMessageBlock(Block block, ReporterID reporterID, const Dictionary& message, MessageCategory category,
                         MessageType type);
    // Waits, at most 5 seconds, until every held delivery has run.
    void waitForCompletion();
    // The deliveries held now (a running one among them).
    std::size_t held() const
    {
        std::size_t unscheduled = 0;
        return counts(unscheduled);
    }
    // Ends the throttle: the worker stops, held deliveries are dropped unrun, and the
    // call returns once the worker has let go of the throttle, so that nothing a
    // delivery uses is still touched (from inside a delivery it returns at once).
    // Later messages are dropped too. The keys whose deliveries were dropped.
    std::vector<std::string> invalidate();

    bool shouldKeepRunning() const { return shouldKeepRunning_.load(); }
    void setShouldKeepRunning(bool keepRunning) { shouldKeepRunning_.store(keepRunning); }

private:
    // One held delivery and its one-shot timer. The timer belongs to the worker's
    // loop and is touched only there; callers move the fire date, which the worker
    // applies.
    struct TimerWrapper {
        MxAtomicProperty<Block> block;
        std::atomic<std::chrono::steady_clock::time_point> fireDate;
        std::unique_ptr<asio::steady_timer> timer;
        bool placed = false; // worker thread only
        void sleepFor(double seconds);
    };

    // Set by the worker once it has let go of the throttle.
    struct WorkerExit {
        std::mutex mutex;
        std::condition_variable changed;
        bool done = false;
    };

    MxReportingBlockThrottle() = default;
    void run();
    void runTimerLoop();
    void idle();
    void dropHeldDeliveries();
    void place(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key);
    void wait(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key);
    void fire(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key);
    std::shared_ptr<TimerWrapper> inFlight(const std::string& key) const;
    std::size_t counts(std::size_t& unscheduled) const;

    // First, so it goes last: every held delivery's timer belongs to it.
    asio::io_context loop_; // the worker thread's timer loop
    std::atomic<bool> shouldKeepRunning_{true};
    std::atomic<bool> invalidated_{false};
    mutable std::recursive_mutex timersInFlightMonitor_;
    std::map<std::string, std::shared_ptr<TimerWrapper>> timersInFlight_;
    mutable std::recursive_mutex unscheduledTimerKeysMonitor_;
    std::vector<std::string> unscheduledTimerKeys_;
    // The worker's idle pass waits here, so that invalidate() need not wait it out.
    std::mutex idleMutex_;
    std::condition_variable idleWake_;
    std::vector<std::string> dropped_; // written by the worker as it ends, read after
    std::shared_ptr<WorkerExit> workerExit_ = std::make_shared<WorkerExit>();
    std::thread queueThread_;
};

} // namespace mx
