#pragma once
// Work queues: the daemon's unit of concurrency. A serial queue runs its work one
// item at a time in submission order, on whatever worker thread is free; a global
// queue runs its work concurrently. Queues are made through the process-wide
// Dispatch service so that tests can drive every queue by hand.

#include <chrono>
#include <memory>
#include <string>

#include "platform/ProcessWide.h"
#include "platform/UniqueFunction.h"

namespace mx {

enum class QueuePriority {
    UserInteractive, // request handling: what a waiting client sees
    Utility,         // backend work, deliveries, background sends
};

class WorkQueue {
public:
    virtual ~WorkQueue() = default;
    virtual const std::string& label() const = 0;
    // Runs `work` after everything dispatched before it (on a serial queue). Callable
    // from any thread, including the queue's own; never runs `work` inline.
    virtual void dispatch(UniqueFunction<void()> work) = 0;
    // Runs `work` once `delay` has passed. Callable from any thread. A shutdown runs it
    // at once: nothing handed to a queue is left behind at exit.
    virtual void dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work) = 0;
    // Runs `work` once `delay` has passed, unless the process ends first: a timeout
    // that a shutdown neither waits for nor brings forward. Callable from any thread.
    virtual void dispatchTimeout(std::chrono::nanoseconds delay, UniqueFunction<void()> work) = 0;
    // True while the calling thread runs work of this queue; for debug assertions.
    virtual bool isCurrent() const = 0;
};

class Dispatch {
public:
    virtual ~Dispatch() = default;
    // A new serial queue. It lives as long as its holders; work already dispatched
    // keeps running after the last holder lets go.
    virtual std::shared_ptr<WorkQueue> makeSerialQueue(std::string label, QueuePriority priority) = 0;
    // The process's concurrent queue of that priority.
    virtual WorkQueue& globalQueue(QueuePriority priority) = 0;
    // Called by work that is about to block its thread (a bounded wait for another
    // thread) and again when it is done, so that other queues' work is not held up
    // behind it. Calls nest and pair up on one thread.
    virtual void beginBlocking() = 0;
    virtual void endBlocking() = 0;
};

// Marks the enclosing scope as blocking the current worker thread.
class ScopedBlockingCall {
public:
    ScopedBlockingCall() : dispatch_(ProcessWide<Dispatch>::get()) { dispatch_.beginBlocking(); }
    ~ScopedBlockingCall() { dispatch_.endBlocking(); }
    ScopedBlockingCall(const ScopedBlockingCall&) = delete;
    ScopedBlockingCall& operator=(const ScopedBlockingCall&) = delete;

private:
    // The end pairs with the beginning even if another implementation was installed meanwhile.
    Dispatch& dispatch_;
};

} // namespace mx
