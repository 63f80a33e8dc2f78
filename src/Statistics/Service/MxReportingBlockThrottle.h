#pragma once
// A per-key debounce for deliveries: a message's delivery is held for the message's
// throttle time and then run on the throttle's own worker thread; a later message
// with the same key replaces the held delivery and starts its wait again, so a burst
// delivers its last message once. Shared: the worker thread holds it while it runs.
// Callers add from any thread; deliveries run one at a time on the worker, in the
// order they fall due.

#include <atomic>
#include <chrono>
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
#include "platform/Value.h"

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

    MxReportingBlockThrottle() = default;
    void run();
    void place(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key);
    void wait(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key);
    void fire(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key);
    std::shared_ptr<TimerWrapper> inFlight(const std::string& key) const;
    std::size_t counts(std::size_t& unscheduled) const;

    std::atomic<bool> shouldKeepRunning_{true};
    mutable std::recursive_mutex timersInFlightMonitor_;
    std::map<std::string, std::shared_ptr<TimerWrapper>> timersInFlight_;
    mutable std::recursive_mutex unscheduledTimerKeysMonitor_;
    std::vector<std::string> unscheduledTimerKeys_;
    asio::io_context loop_; // the worker thread's timer loop
    std::thread queueThread_;
};

} // namespace mx
