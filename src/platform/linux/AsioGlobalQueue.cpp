#include "platform/linux/AsioGlobalQueue.h"

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

namespace mx {

AsioGlobalQueue::AsioGlobalQueue(std::string label, AsioWorkerPool& pool, AsioOutstandingWork& work)
    : label_(std::move(label)), pool_(pool), work_(work)
{
}

void AsioGlobalQueue::dispatch(UniqueFunction<void()> work)
{
    work_.begin();
    asio::post(pool_.executor(), [&outstanding = work_, work = std::move(work)]() mutable {
        work();
        outstanding.end();
    });
}

void AsioGlobalQueue::dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    work_.runAfter(std::make_shared<asio::steady_timer>(pool_.executor(), delay), std::move(work));
}

void AsioGlobalQueue::dispatchTimeout(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    auto timer = std::make_shared<asio::steady_timer>(pool_.executor(), delay);
    timer->async_wait([timer, work = std::move(work)](const std::error_code&) mutable { work(); });
}

} // namespace mx
