#include "platform/linux/AsioSerialQueue.h"

#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include "platform/linux/AsioHandOver.h"

namespace mx {

AsioSerialQueue::AsioSerialQueue(std::string label, const asio::io_context::executor_type& executor,
                                 AsioOutstandingWork& work)
    : label_(std::move(label)), strand_(asio::make_strand(executor)), work_(work)
{
}

void AsioSerialQueue::dispatch(UniqueFunction<void()> work)
{
    work_.begin();
    auto job = [&outstanding = work_, owner = static_cast<const void*>(this), work = std::move(work)]() mutable {
        {
            AsioHandOver handOver(owner);
            work();
        }
        outstanding.end();
    };
    auto* handOver = AsioHandOver::takingFrom(this, strand_.get_inner_executor().context());
    if (handOver == nullptr) {
        asio::post(strand_, std::move(job));
        return;
    }
    handOver->add([strand = strand_, job = std::move(job)]() mutable {
        // A queue whose work is further up this thread's stack keeps its order too.
        if (strand.running_in_this_thread())
            asio::post(strand, std::move(job));
        else
            asio::dispatch(strand, std::move(job));
    });
}

void AsioSerialQueue::dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    work_.runAfter(std::make_shared<asio::steady_timer>(strand_, delay), std::move(work));
}

void AsioSerialQueue::dispatchTimeout(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    auto timer = std::make_shared<asio::steady_timer>(strand_, delay);
    timer->async_wait([timer, work = std::move(work)](const std::error_code&) mutable { work(); });
}

} // namespace mx
