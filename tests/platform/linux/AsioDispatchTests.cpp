#include "platform/linux/AsioDispatch.h"

#include <condition_variable>
#include <future>
#include <mutex>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace mx {
namespace {

constexpr auto kBound = std::chrono::seconds(10);

TEST(AsioDispatchTest, SerialQueueRunsInSubmissionOrderOneAtATime)
{
    AsioDispatch dispatch(2);
    auto queue = dispatch.makeSerialQueue("test.serial", QueuePriority::Utility);
    std::vector<int> order;
    std::atomic<int> running{0};
    bool overlapped = false;
    std::promise<void> done;
    for (int i = 0; i < 1000; ++i)
        queue->dispatch([&, i] {
            if (running.fetch_add(1) != 0)
                overlapped = true;
            EXPECT_TRUE(queue->isCurrent());
            order.push_back(i);
            running.fetch_sub(1);
            if (i == 999)
                done.set_value();
        });
    ASSERT_EQ(done.get_future().wait_for(kBound), std::future_status::ready);
    EXPECT_FALSE(overlapped);
    ASSERT_EQ(order.size(), 1000u);
    for (int i = 0; i < 1000; ++i)
        EXPECT_EQ(order[i], i);
    EXPECT_FALSE(queue->isCurrent());
}

// A job's hand-over to another queue runs once the job has returned (at once, if that
// queue is idle); what it gives its own queue waits behind what was there already.
TEST(AsioDispatchTest, WorkAJobGivesRunsAfterItAndItsOwnQueueKeepsItsOrder)
{
    AsioDispatch dispatch(1);
    auto server = dispatch.makeSerialQueue("test.server", QueuePriority::UserInteractive);
    auto connection = dispatch.makeSerialQueue("test.connection", QueuePriority::UserInteractive);
    std::vector<std::string> order;
    std::promise<void> queuedBefore;
    std::promise<void> done;
    server->dispatch([&] {
        queuedBefore.get_future().wait();
        connection->dispatch([&] { order.emplace_back("handed over"); });
        server->dispatch([&] {
            order.emplace_back("own, given");
            done.set_value();
        });
        order.emplace_back("giver returns");
    });
    server->dispatch([&] { order.emplace_back("own, queued before"); });
    queuedBefore.set_value();
    ASSERT_EQ(done.get_future().wait_for(kBound), std::future_status::ready);
    EXPECT_EQ(order, (std::vector<std::string>{"giver returns", "handed over", "own, queued before", "own, given"}));
}

TEST(AsioDispatchTest, QueuesBlockedInAWaitDoNotHoldUpOtherQueues)
{
    AsioDispatch dispatch(1);
    ScopedInstall<Dispatch> install(dispatch);
    std::mutex mutex;
    std::condition_variable released;
    bool release = false;
    std::vector<std::shared_ptr<WorkQueue>> blocked;
    for (int i = 0; i < 4; ++i) {
        blocked.push_back(dispatch.makeSerialQueue("test.blocked", QueuePriority::Utility));
        blocked.back()->dispatch([&] {
            ScopedBlockingCall blocking;
            std::unique_lock lock(mutex);
            released.wait_for(lock, kBound, [&] { return release; });
        });
    }
    std::promise<void> ran;
    auto free = dispatch.makeSerialQueue("test.free", QueuePriority::Utility);
    free->dispatch([&] { ran.set_value(); });
    EXPECT_EQ(ran.get_future().wait_for(kBound), std::future_status::ready);
    {
        std::lock_guard lock(mutex);
        release = true;
    }
    released.notify_all();
}

TEST(AsioDispatchTest, DelayedWorkRunsAfterItsDelayOnItsQueue)
{
    AsioDispatch dispatch(2);
    auto queue = dispatch.makeSerialQueue("test.delayed", QueuePriority::UserInteractive);
    std::promise<std::chrono::steady_clock::time_point> ran;
    auto began = std::chrono::steady_clock::now();
    queue->dispatchAfter(std::chrono::milliseconds(50), [&] {
        EXPECT_TRUE(queue->isCurrent());
        ran.set_value(std::chrono::steady_clock::now());
    });
    auto future = ran.get_future();
    ASSERT_EQ(future.wait_for(kBound), std::future_status::ready);
    EXPECT_GE(future.get() - began, std::chrono::milliseconds(50));

    std::promise<void> global;
    dispatch.globalQueue(QueuePriority::Utility).dispatchAfter(std::chrono::milliseconds(1), [&] {
        global.set_value();
    });
    EXPECT_EQ(global.get_future().wait_for(kBound), std::future_status::ready);
}

} // namespace
} // namespace mx
