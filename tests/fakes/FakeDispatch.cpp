#include "fakes/FakeDispatch.h"

#include <algorithm>

namespace mx::testing {

namespace {
thread_local const FakeWorkQueue* runningQueue = nullptr;
}

FakeWorkQueue::FakeWorkQueue(std::string label, QueuePriority priority, FakeDispatch& dispatch)
    : label_(std::move(label)), priority_(priority), dispatch_(dispatch)
{
}

void FakeWorkQueue::dispatch(UniqueFunction<void()> work)
{
    std::lock_guard lock(mutex_);
    ready_.push_back(std::move(work));
}

void FakeWorkQueue::dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work)
{
    std::lock_guard lock(mutex_);
    delayed_.push_back({dispatch_.now() + delay, std::move(work)});
}

bool FakeWorkQueue::isCurrent() const { return runningQueue == this; }

bool FakeWorkQueue::runOne()
{
    UniqueFunction<void()> work;
    {
        std::lock_guard lock(mutex_);
        if (ready_.empty())
            return false;
        work = std::move(ready_.front());
        ready_.pop_front();
    }
    const FakeWorkQueue* outer = runningQueue;
    runningQueue = this;
    work();
    runningQueue = outer;
    return true;
}

FakeDispatch::FakeDispatch()
    : interactive_(std::make_shared<FakeWorkQueue>("global.interactive", QueuePriority::UserInteractive, *this)),
      utility_(std::make_shared<FakeWorkQueue>("global.utility", QueuePriority::Utility, *this))
{
    queues_ = {interactive_, utility_};
}

std::shared_ptr<WorkQueue> FakeDispatch::makeSerialQueue(std::string label, QueuePriority priority)
{
    auto queue = std::make_shared<FakeWorkQueue>(std::move(label), priority, *this);
    queues_.push_back(queue);
    return queue;
}

WorkQueue& FakeDispatch::globalQueue(QueuePriority priority)
{
    return priority == QueuePriority::UserInteractive ? *interactive_ : *utility_;
}

void FakeDispatch::runUntilIdle()
{
    bool ran = true;
    while (ran) {
        ran = false;
        // Index loop: work may make new queues.
        for (std::size_t i = 0; i < queues_.size(); ++i)
            while (queues_[i]->runOne())
                ran = true;
    }
}

void FakeDispatch::discardAll()
{
    for (auto& queue : queues_) {
        std::deque<UniqueFunction<void()>> ready;
        std::vector<FakeWorkQueue::Delayed> delayed;
        {
            std::lock_guard lock(queue->mutex_);
            ready.swap(queue->ready_);
            delayed.swap(queue->delayed_);
        }
        // Destroyed outside the lock: dropped work may release sessions that log.
    }
}

void FakeDispatch::advance(std::chrono::nanoseconds by)
{
    now_ += by;
    for (auto& queue : queues_) {
        std::lock_guard lock(queue->mutex_);
        auto& delayed = queue->delayed_;
        std::stable_sort(delayed.begin(), delayed.end(), [](const auto& a, const auto& b) { return a.due < b.due; });
        auto due = std::find_if(delayed.begin(), delayed.end(), [this](const auto& item) { return item.due > now_; });
        for (auto item = delayed.begin(); item != due; ++item)
            queue->ready_.push_back(std::move(item->work));
        delayed.erase(delayed.begin(), due);
    }
}

} // namespace mx::testing
