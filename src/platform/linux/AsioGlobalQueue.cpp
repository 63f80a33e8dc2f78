#include "platform/linux/AsioGlobalQueue.h"

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

namespace mx {

AsioGlobalQueue::AsioGlobalQueue(std::string label, AsioWorkerPool& pool) : label_(std::move(label)), pool_(pool) {}

void AsioGlobalQueue::dispatch(UniqueFunction<void()> work) { asio::post(pool_.executor(), std::move(work)); }

void AsioGlobalQueue::dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    auto timer = std::make_shared<asio::steady_timer>(pool_.executor(), delay);
    timer->async_wait([timer, work = std::move(work)](const std::error_code&) mutable { work(); });
}

} // namespace mx
