#include "platform/linux/SqliteWriter.h"

#include <algorithm>
#include <cerrno>
#include <pthread.h>
#include <sched.h>
#include <sys/resource.h>
#include <system_error>
#include <unistd.h>

#include <sqlite3.h>

#include "platform/MxLog.h"
#include "platform/UniqueFunction.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

namespace {

// The writer and the checkpoints yield the processor to request handling: a commit
// that takes the CPU a client's request wakes on delays its reply by the length of the
// commit. In the background (SCHED_IDLE) a thread that wakes takes the processor from
// them at once. A low weight alone did not do that: at nice 10 the scheduler let a
// round of commits run on for up to 2.5 ms before a request thread it had woken, or
// the client waiting on a reply, got the processor, and at 10 000 reports/s one reply
// in a hundred waited that long. A writer that clients wait on comes forward to nice
// 10, so that under sustained load it still gets its share and the clients' accounts
// slow requests down only to the rate it commits at.
constexpr int kWriterNiceness = 10;

bool moveTo(pid_t thread, int policy)
{
    sched_param parameters{};
    return sched_setscheduler(thread, policy, &parameters) == 0;
}

std::thread startInBackground(const char* name, UniqueFunction<void()> body)
{
    return std::thread([name, body = std::move(body)]() mutable {
        pthread_setname_np(pthread_self(), name);
        setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), kWriterNiceness);
        moveTo(0, SCHED_IDLE);
        body();
    });
}

struct SharedWriter {
    std::mutex mutex;
    std::weak_ptr<SqliteWriter> writer;
};

SharedWriter& sharedWriter()
{
    static auto* shared = new SharedWriter; // outlives any store closed at exit
    return *shared;
}

} // namespace

std::shared_ptr<SqliteWriter> SqliteWriter::shared()
{
    auto& shared = sharedWriter();
    std::lock_guard lock(shared.mutex);
    auto writer = shared.writer.lock();
    if (!writer) {
        writer = std::make_shared<SqliteWriter>();
        shared.writer = writer;
    }
    return writer;
}

SqliteWriter::SqliteWriter()
    : thread_(startInBackground("mx-store", [this] { run(); })),
      checkpointer_(startInBackground("mx-checkpoint", [this] { runCheckpoints(); }))
{
}

SqliteWriter::~SqliteWriter()
{
    {
        std::lock_guard lock(mutex_);
        closing_ = true;
    }
    changed_.notify_all();
    checkpointsChanged_.notify_all();
    thread_.join();
    checkpointer_.join();
}

void SqliteWriter::attach(SqliteStore& store) { stores_.push_back(&store); }

void SqliteWriter::detach(SqliteStore& store, std::unique_lock<std::mutex>& lock)
{
    changed_.wait(lock, [&] { return !inRound_; });
    std::erase(stores_, &store);
}

void SqliteWriter::queued(std::size_t depth, bool kept)
{
    if (waiting_ || (gathering_ && depth == SqliteStore::kBatchLimit)) {
        changed_.notify_all();
        return;
    }
    if (kept || !gathering_)
        return;
    auto shortEnd = std::chrono::steady_clock::now() + SqliteStore::kBatchWindow;
    if (shortEnd < windowEnd_) {
        windowEnd_ = shortEnd;
        changed_.notify_all();
    }
}

void SqliteWriter::hurry()
{
    flushing_ = true;
    comeForward(true);
    changed_.notify_all();
}

// Under the lock. Leaving the background takes CAP_SYS_NICE (or RLIMIT_NICE of 10):
// without it the writer stays there, and under load its clients wait longer on it.
void SqliteWriter::comeForward(bool forward)
{
    if (forward == forward_ || writerThread_ == 0 || forwardRefused_)
        return;
    if (moveTo(writerThread_, forward ? SCHED_OTHER : SCHED_IDLE)) {
        forward_ = forward;
        return;
    }
    forwardRefused_ = true;
    MXLOG_LIMITED(nullptr, Default,
                  "the store writer cannot come forward when clients wait on it ({}): it stays in the background",
                  std::generic_category().message(errno));
}

void SqliteWriter::checkpoint(const std::filesystem::path& path)
{
    if (std::ranges::find(checkpoints_, path) != checkpoints_.end())
        return;
    checkpoints_.push_back(path);
    checkpointsChanged_.notify_one();
}

bool SqliteWriter::anyWork() const
{
    return std::ranges::any_of(stores_, [](const SqliteStore* store) { return store->hasWork(); });
}

bool SqliteWriter::anyHurried() const
{
    return std::ranges::any_of(stores_, [](const SqliteStore* store) { return store->anyHurried(); });
}

bool SqliteWriter::anyUrgent() const
{
    return flushing_ || closing_ ||
        std::ranges::any_of(stores_, [](const SqliteStore* store) { return store->wantsRound(); });
}

std::chrono::steady_clock::time_point SqliteWriter::nextRetry() const
{
    auto next = std::chrono::steady_clock::time_point::max();
    for (const auto* store : stores_)
        if (auto retry = store->retryAt())
            next = std::min(next, *retry);
    return next;
}

void SqliteWriter::run()
{
    std::unique_lock lock(mutex_);
    writerThread_ = gettid();
    comeForward(flushing_);
    // While rows keep coming the writer gathers window after window on its own clock,
    // and callers never wake it; a window that brings nothing makes it quiet, and then
    // the next row wakes it.
    bool active = false;
    for (;;) {
        if (!active && !anyWork()) {
            if (closing_)
                return;
            cutBackLogs(lock);
            waiting_ = true;
            changed_.wait(lock, [&] { return anyWork() || closing_; });
            waiting_ = false;
            continue;
        }
        gather(lock);
        active = writeRound(lock) || anyWork();
        comeForward(flushing_);
    }
}

// Until the window ends, a batch fills, or a retry is due. The window is the long one
// while every queued row is kept among its store's pending rows and no reader wants
// one soon, and a row that is not so cuts it short (queued).
void SqliteWriter::gather(std::unique_lock<std::mutex>& lock)
{
    gathering_ = true;
    windowEnd_ =
        std::chrono::steady_clock::now() + (anyHurried() ? SqliteStore::kBatchWindow : SqliteStore::kKeptWindow);
    while (!anyUrgent()) {
        auto until = std::min(windowEnd_, nextRetry());
        if (std::chrono::steady_clock::now() >= until)
            break;
        changed_.wait_until(lock, until);
    }
    gathering_ = false;
}

// Each store with rows, or with a failed batch whose retry is due, writes one batch.
// False when none had any.
bool SqliteWriter::writeRound(std::unique_lock<std::mutex>& lock)
{
    auto now = std::chrono::steady_clock::now();
    std::vector<SqliteStore*> due;
    for (auto* store : stores_)
        if (store->takeBatch(now))
            due.push_back(store);
    // A flush waits on rows beyond a batch: the next round goes at once.
    flushing_ =
        flushing_ && std::ranges::any_of(due, [](const SqliteStore* store) { return store->queuedBeyondBatch(); });
    if (due.empty())
        return false;
    inRound_ = true;
    lock.unlock();
    for (auto* store : due)
        store->settleTaken();
    for (auto* store : due)
        store->writeBatch();
    lock.lock();
    inRound_ = false;
    for (auto* store : due)
        store->endRound();
    changed_.notify_all();
    return true;
}

// A store gone quiet gives back what its log grew to in a burst.
void SqliteWriter::cutBackLogs(std::unique_lock<std::mutex>& lock)
{
    inRound_ = true;
    auto stores = stores_;
    lock.unlock();
    for (auto* store : stores)
        store->cutBackLog();
    lock.lock();
    inRound_ = false;
    changed_.notify_all();
}

// On a connection of its own, opened for the one checkpoint: they are a few a second at
// most. A store set aside meanwhile has no file to open, and a new one is not made here.
void SqliteWriter::runCheckpoints()
{
    std::unique_lock lock(mutex_);
    for (;;) {
        checkpointsChanged_.wait(lock, [&] { return !checkpoints_.empty() || closing_; });
        if (closing_)
            return;
        auto path = std::move(checkpoints_.front());
        checkpoints_.pop_front();
        lock.unlock();
        sqlite3* database = nullptr;
        // A connection learns that the file has a log only when it first reads it: a
        // checkpoint before that finds nothing to do.
        if (sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr) ==
                SQLITE_OK &&
            sqlite3_exec(database, "SELECT 1 FROM sqlite_schema LIMIT 1", nullptr, nullptr, nullptr) == SQLITE_OK)
            sqlite3_wal_checkpoint_v2(database, nullptr, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
        sqlite3_close(database);
        lock.lock();
    }
}

} // namespace mx
