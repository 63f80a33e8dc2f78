#pragma once
// The Linux work queues: one worker pool per priority, serial queues as strands over
// it, and a concurrent global queue per priority. Installed once by main; queues
// must not outlive it.

#include <memory>

#include "platform/WorkQueue.h"
#include "platform/linux/AsioGlobalQueue.h"
#include "platform/linux/AsioWorkerPool.h"

namespace mx {

class AsioDispatch final : public Dispatch {
public:
    // `threadsPerPool` 0: one thread for user-interactive work (a single serial
    // queue) and one per two cores for utility work. Fewer threads mean fewer
    // wake-ups under load; work that blocks is lent a spare thread, so a small pool
    // never deadlocks on a wait.
    explicit AsioDispatch(unsigned threadsPerPool = 0);
    ~AsioDispatch() override;

    std::shared_ptr<WorkQueue> makeSerialQueue(std::string label, QueuePriority priority) override;
    WorkQueue& globalQueue(QueuePriority priority) override;
    void beginBlocking() override;
    void endBlocking() override;

    // The user-interactive pool's context, for I/O whose handlers should run on the
    // thread that runs the server queue: a request then crosses no thread.
    asio::io_context& interactiveContext() { return interactivePool_.context(); }

    // Runs delayed work at once and waits, at most `bound`, until no queue has work
    // left; work dispatched meanwhile is waited for too. False when work remains.
    bool drain(std::chrono::milliseconds bound) { return outstanding_.drain(bound); }

private:
    AsioWorkerPool& pool(QueuePriority priority);

    AsioOutstandingWork outstanding_;
    AsioWorkerPool interactivePool_;
    AsioWorkerPool utilityPool_;
    AsioGlobalQueue interactiveQueue_;
    AsioGlobalQueue utilityQueue_;
};

} // namespace mx
