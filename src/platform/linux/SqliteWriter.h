#pragma once
// The one thread that writes every open SQLite store, each in batches, on one clock. At
// everyday rates a commit's wake-up costs more than the rows it carries, and a thread
// per store woke once a window for each store: now one wake-up a window commits every
// store's rows in turn, with SQLite's code still warm from the store before.
// A store that cannot write holds its batch and is retried on its own schedule while
// the others go on. A second thread checkpoints the stores' logs into their files: a
// checkpoint waits on the disk, and no store's rows wait with it. Both threads run in
// the background (SCHED_IDLE), so request handling takes the processor from them at
// once; the writer comes forward while clients wait on it. Stores attach while they
// are open and the threads run while any is; one lock guards every attached store's
// queue.

#include <chrono>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <memory>
#include <mutex>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace mx {

class SqliteStore;

class SqliteWriter {
public:
    // The writer of every store open in the process, started by the first.
    static std::shared_ptr<SqliteWriter> shared();
    SqliteWriter();
    ~SqliteWriter();
    SqliteWriter(const SqliteWriter&) = delete;
    SqliteWriter& operator=(const SqliteWriter&) = delete;

    std::mutex& mutex() { return mutex_; }
    // Woken: the writer, and callers waiting for it. Under the lock.
    std::condition_variable& changed() { return changed_; }

    // Under the lock.
    void attach(SqliteStore& store);
    // Under the lock, once the store has nothing left: waits for a round under way.
    void detach(SqliteStore& store, std::unique_lock<std::mutex>& lock);
    // Under the lock, after a row was queued on a store that now holds `depth`: a quiet
    // writer is woken by the first row, a gathering one by the row that fills a batch;
    // the rows between wait for the window to end. A row not `kept` among its store's
    // pending rows cuts a long window short.
    void queued(std::size_t depth, bool kept);
    // Under the lock: a flush, a closing store or a client held back wants its rows now,
    // not at the window's end, and the writer comes out of the background until none does.
    void hurry();
    // Under the lock: the store at `path` has a log past its mark.
    void checkpoint(const std::filesystem::path& path);

private:
    void run();
    bool anyWork() const;
    bool anyUrgent() const;
    bool anyHurried() const;
    void gather(std::unique_lock<std::mutex>& lock);
    std::chrono::steady_clock::time_point nextRetry() const;
    bool writeRound(std::unique_lock<std::mutex>& lock);
    void cutBackLogs(std::unique_lock<std::mutex>& lock);
    void comeForward(bool forward);
    void runCheckpoints();

    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<SqliteStore*> stores_;
    bool waiting_ = false;                              // quiet, for a first row
    bool gathering_ = false;                            // for the window to end or a batch to fill
    std::chrono::steady_clock::time_point windowEnd_{}; // brought forward by a row not kept
    bool flushing_ = false; // hurried (a flush, a close, a client held back): the batches at hand go now
    bool inRound_ = false;  // working on stores without the lock
    bool closing_ = false;
    pid_t writerThread_ = 0;      // the writer's thread, to move it
    bool forward_ = false;        // at nice 10 rather than in the background
    bool forwardRefused_ = false; // not permitted to come forward
    std::deque<std::filesystem::path> checkpoints_;
    std::condition_variable checkpointsChanged_;
    std::thread thread_;
    std::thread checkpointer_;
};

} // namespace mx
