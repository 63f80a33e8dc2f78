#pragma once
// Work queues that run only when the test says so. Every queue made through the fake
// dispatch holds its work until runUntilIdle(); delayed work waits for advance().
// Single-threaded: the test thread runs everything.

#include <chrono>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/WorkQueue.h"

namespace mx::testing {

class FakeDispatch;

class FakeWorkQueue final : public WorkQueue {
public:
    FakeWorkQueue(std::string label, QueuePriority priority, FakeDispatch& dispatch);

    const std::string& label() const override { return label_; }
    QueuePriority priority() const { return priority_; }
    void dispatch(UniqueFunction<void()> work) override;
    void dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work) override;
    // Moved by the test's time, as delayed work is.
    void dispatchTimeout(std::chrono::nanoseconds delay, UniqueFunction<void()> work) override
    {
        dispatchAfter(delay, std::move(work));
    }
    bool isCurrent() const override;

    // Runs one ready item; false when none was ready.
    bool runOne();

private:
    friend class FakeDispatch;
    struct Delayed {
        std::chrono::nanoseconds due;
        UniqueFunction<void()> work;
    };

    std::string label_;
    QueuePriority priority_;
    FakeDispatch& dispatch_;
    mutable std::mutex mutex_;
    std::deque<UniqueFunction<void()>> ready_;
    std::vector<Delayed> delayed_;
};

class FakeDispatch final : public Dispatch {
public:
    FakeDispatch();

    std::shared_ptr<WorkQueue> makeSerialQueue(std::string label, QueuePriority priority) override;
    WorkQueue& globalQueue(QueuePriority priority) override;
    void beginBlocking() override { ++blockingCalls_; }
    void endBlocking() override {}

    // Runs ready work of every queue, round robin, until none is left.
    void runUntilIdle();
    // Drops all pending work unrun (what a dying process does to its queues).
    void discardAll();
    // Moves fake time on, making delayed work that falls due ready (not running it).
    void advance(std::chrono::nanoseconds by);
    std::chrono::nanoseconds now() const { return now_; }

    int blockingCalls() const { return blockingCalls_; }

private:
    std::chrono::nanoseconds now_{0};
    std::vector<std::shared_ptr<FakeWorkQueue>> queues_;
    std::shared_ptr<FakeWorkQueue> interactive_;
    std::shared_ptr<FakeWorkQueue> utility_;
    int blockingCalls_ = 0;
};

} // namespace mx::testing
