#pragma once
// The work dispatched to the daemon's queues and not yet run. Shutdown waits on it
// until every queue is idle, and once shutdown has begun, delayed work runs at once
// instead of at its time: nothing handed to a queue is left behind at exit.
// Owned by AsioDispatch, shared by its queues; thread-safe.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <list>
#include <memory>
#include <mutex>

#include <asio/steady_timer.hpp>

#include "platform/UniqueFunction.h"

namespace mx {

class AsioOutstandingWork {
public:
    // A queue calls begin() as it takes work and end() once the work has run.
    void begin() { outstanding_.fetch_add(1, std::memory_order_relaxed); }
    void end();

    // Runs `work` on `timer`'s executor once the timer expires, or at once when
    // shutdown begins first.
    void runAfter(const std::shared_ptr<asio::steady_timer>& timer, UniqueFunction<void()> work);

    // Expedites delayed work and waits until no work is left, at most `bound`.
    // False when work remains at the bound.
    bool drain(std::chrono::milliseconds bound);

private:
    std::atomic<std::int64_t> outstanding_{0};
    std::atomic<bool> draining_{false};
    std::mutex mutex_;
    std::condition_variable idle_;
    // Timers are touched only under the mutex: armed here, cancelled by drain.
    std::list<std::weak_ptr<asio::steady_timer>> timers_;
};

} // namespace mx
