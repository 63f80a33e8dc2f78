#pragma once
// A pool of worker threads running one Asio I/O context: the threads behind every
// queue of one priority. Work that blocks its thread in a bounded wait declares it
// (beginBlocking/endBlocking), and the pool lends a spare thread for the duration,
// so that a hundred sessions waiting on backend discovery never starve the others.
// Owned by AsioDispatch; lives as long as the process.

#include <atomic>
#include <list>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>

namespace mx {

class AsioWorkerPool {
public:
    AsioWorkerPool(std::string name, unsigned threads, int niceness);
    ~AsioWorkerPool();
    AsioWorkerPool(const AsioWorkerPool&) = delete;
    AsioWorkerPool& operator=(const AsioWorkerPool&) = delete;

    asio::io_context::executor_type executor() { return io_.get_executor(); }
    asio::io_context& context() { return io_; }
    bool runsCurrentThread() const { return current() == this; }

    void beginBlocking();
    void endBlocking();

    // The pool whose worker is the calling thread, or nullptr.
    static AsioWorkerPool* current();

private:
    struct SpareWorker {
        std::thread thread;
        std::atomic<bool> finished{false};
    };

    void enterWorker();
    void runSpare(SpareWorker& spare);
    bool claimRetirement();
    void reapFinishedSpares();

    std::string name_;
    int niceness_;
    asio::io_context io_;
    asio::executor_work_guard<asio::io_context::executor_type> keepRunning_;
    std::vector<std::thread> workers_;

    std::mutex sparesMutex_;
    std::list<SpareWorker> spares_;
    std::atomic<int> retirements_{0};
};

} // namespace mx
