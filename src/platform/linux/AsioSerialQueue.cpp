#include "platform/linux/AsioSerialQueue.h"

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

namespace mx {

AsioSerialQueue::AsioSerialQueue(std::string label, const asio::io_context::executor_type& executor)
    : label_(std::move(label)), strand_(asio::make_strand(executor))
{
}

void AsioSerialQueue::dispatch(UniqueFunction<void()> work) { asio::post(strand_, std::move(work)); }

void AsioSerialQueue::dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    auto timer = std::make_shared<asio::steady_timer>(strand_, delay);
    timer->async_wait([timer, work = std::move(work)](const std::error_code&) mutable { work(); });
}

} // namespace mx
