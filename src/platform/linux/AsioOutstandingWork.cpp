#include "platform/linux/AsioOutstandingWork.h"

namespace mx {

void AsioOutstandingWork::end()
{
    if (outstanding_.fetch_sub(1, std::memory_order_acq_rel) == 1 && draining_.load()) {
        std::lock_guard lock(mutex_);
        idle_.notify_all();
    }
}

void AsioOutstandingWork::runAfter(const std::shared_ptr<asio::steady_timer>& timer, UniqueFunction<void()> work)
{
    std::lock_guard lock(mutex_);
    std::erase_if(timers_, [](const auto& armed) { return armed.expired(); });
    // Expired or cancelled, the work runs: a cancel comes only from shutdown.
    begin();
    timer->async_wait([this, timer, work = std::move(work)](const std::error_code&) mutable {
        work();
        end();
    });
    if (draining_.load())
        timer->cancel();
    else
        timers_.push_back(timer);
}

bool AsioOutstandingWork::drain(std::chrono::milliseconds bound)
{
    std::unique_lock lock(mutex_);
    draining_.store(true);
    for (const auto& armed : timers_)
        if (auto timer = armed.lock())
            timer->cancel();
    timers_.clear();
    return idle_.wait_for(lock, bound, [&] { return outstanding_.load() == 0; });
}

} // namespace mx
