#include "platform/linux/AsioSerialQueue.h"

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

namespace mx {

AsioSerialQueue::AsioSerialQueue(std::string label, const asio::io_context::executor_type& executor,
                                 AsioOutstandingWork& work)
    : label_(std::move(label)), strand_(asio::make_strand(executor)), work_(work)
{
}

void AsioSerialQueue::dispatch(UniqueFunction<void()> work)
{
    work_.begin();
    asio::post(strand_, [&outstanding = work_, work = std::move(work)]() mutable {
        work();
        outstanding.end();
    });
}

void AsioSerialQueue::dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    work_.runAfter(std::make_shared<asio::steady_timer>(strand_, delay), std::move(work));
}

} // namespace mx
