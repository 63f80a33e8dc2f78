#include "platform/linux/AsioWorkerPool.h"

#include <chrono>
#include <pthread.h>
#include <sys/resource.h>
#include <unistd.h>

namespace mx {

namespace {

thread_local AsioWorkerPool* currentPool = nullptr;

// A spare thread whose blocked peer has finished retires after at most this long idle.
constexpr auto kSpareIdlePoll = std::chrono::milliseconds(100);

} // namespace

AsioWorkerPool::AsioWorkerPool(std::string name, unsigned threads, int niceness)
    : name_(std::move(name)), niceness_(niceness), keepRunning_(io_.get_executor())
{
    workers_.reserve(threads);
    for (unsigned i = 0; i < threads; ++i)
        workers_.emplace_back([this] {
            enterWorker();
            io_.run();
        });
}

AsioWorkerPool::~AsioWorkerPool()
{
    keepRunning_.reset();
    io_.stop();
    for (auto& worker : workers_)
        worker.join();
    std::lock_guard lock(sparesMutex_);
    for (auto& spare : spares_)
        spare.thread.join();
}

AsioWorkerPool* AsioWorkerPool::current() { return currentPool; }

void AsioWorkerPool::enterWorker()
{
    currentPool = this;
    pthread_setname_np(pthread_self(), name_.substr(0, 15).c_str());
    if (niceness_ != 0)
        setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), niceness_);
}

void AsioWorkerPool::beginBlocking()
{
    std::lock_guard lock(sparesMutex_);
    reapFinishedSpares();
    auto& spare = spares_.emplace_back();
    spare.thread = std::thread([this, &spare] { runSpare(spare); });
}

void AsioWorkerPool::endBlocking() { retirements_.fetch_add(1, std::memory_order_acq_rel); }

bool AsioWorkerPool::claimRetirement()
{
    int pending = retirements_.load(std::memory_order_acquire);
    while (pending > 0)
        if (retirements_.compare_exchange_weak(pending, pending - 1, std::memory_order_acq_rel))
            return true;
    return false;
}

void AsioWorkerPool::runSpare(SpareWorker& spare)
{
    enterWorker();
    while (!io_.stopped() && !claimRetirement())
        io_.run_one_for(kSpareIdlePoll);
    spare.finished.store(true, std::memory_order_release);
}

void AsioWorkerPool::reapFinishedSpares()
{
    for (auto spare = spares_.begin(); spare != spares_.end();) {
        if (!spare->finished.load(std::memory_order_acquire)) {
            ++spare;
            continue;
        }
        spare->thread.join();
        spare = spares_.erase(spare);
    }
}

} // namespace mx
