#pragma once
// A concurrent work queue: work goes straight to its worker pool and runs on any
// free thread, in no particular order.

#include "platform/WorkQueue.h"
#include "platform/linux/AsioOutstandingWork.h"
#include "platform/linux/AsioWorkerPool.h"

namespace mx {

class AsioGlobalQueue final : public WorkQueue {
public:
    AsioGlobalQueue(std::string label, AsioWorkerPool& pool, AsioOutstandingWork& work);

    const std::string& label() const override { return label_; }
    void dispatch(UniqueFunction<void()> work) override;
    void dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work) override;
    void dispatchTimeout(std::chrono::nanoseconds delay, UniqueFunction<void()> work) override;
    bool isCurrent() const override { return pool_.runsCurrentThread(); }

private:
    std::string label_;
    AsioWorkerPool& pool_;
    AsioOutstandingWork& work_;
};

} // namespace mx
