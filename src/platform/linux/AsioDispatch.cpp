#include "platform/linux/AsioDispatch.h"

#include <algorithm>
#include <thread>

#include "platform/linux/AsioSerialQueue.h"

namespace mx {

namespace {

// Background work yields the processor to request handling under load.
constexpr int kUtilityNiceness = 5;

} // namespace

AsioDispatch::AsioDispatch(unsigned threadsPerPool)
    // Request work is one serial queue: a second thread would only bounce it between cores.
    : interactivePool_("mx-interactive", threadsPerPool != 0 ? threadsPerPool : 1, 0),
      utilityPool_("mx-utility",
                   threadsPerPool != 0 ? threadsPerPool : std::max(1u, std::thread::hardware_concurrency() / 2),
                   kUtilityNiceness),
      interactiveQueue_("com.kestrel.harmonia.global.interactive", interactivePool_, outstanding_),
      utilityQueue_("com.kestrel.harmonia.global.utility", utilityPool_, outstanding_)
{
}

AsioDispatch::~AsioDispatch() = default;

AsioWorkerPool& AsioDispatch::pool(QueuePriority priority)
{
    return priority == QueuePriority::UserInteractive ? interactivePool_ : utilityPool_;
}

std::shared_ptr<WorkQueue> AsioDispatch::makeSerialQueue(std::string label, QueuePriority priority)
{
    return std::make_shared<AsioSerialQueue>(std::move(label), pool(priority).executor(), outstanding_);
}

WorkQueue& AsioDispatch::globalQueue(QueuePriority priority)
{
    return priority == QueuePriority::UserInteractive ? static_cast<WorkQueue&>(interactiveQueue_)
                                                      : static_cast<WorkQueue&>(utilityQueue_);
}

void AsioDispatch::beginBlocking()
{
    if (auto* pool = AsioWorkerPool::current())
        pool->beginBlocking();
}

void AsioDispatch::endBlocking()
{
    if (auto* pool = AsioWorkerPool::current())
        pool->endBlocking();
}

} // namespace mx
