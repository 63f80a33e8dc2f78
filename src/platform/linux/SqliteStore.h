#pragma once
// An embedded SQLite store written in batches by the process's one store writer
// (SqliteWriter). Callers hand over rows and go on, never waiting: each row is a debt
// on the account of the client whose request made it (BacklogAccount), settled once
// the writer takes the row into a batch (bounded by its own limit), and a client whose
// rows wait past its bound is taken no further request from, and has its rows taken
// at once rather than at the window's end. So the queue is bounded by what its
// clients may owe, nothing is ever dropped, and a slow store holds back the clients
// that fill it and no other.
// WAL journaling keeps every committed batch across a crash, and the rows not yet
// committed are kept in a file beside the store (SqlitePendingRows) that open writes in
// after a crash; destruction commits everything handed over before.
// Failure policy: a batch that cannot be written (full or read-only disk, the file
// removed) is held and retried with backoff until it commits, while the rows queued
// behind it stay on their clients' accounts and the other stores go on; the failure
// is logged when it starts and when it clears. A file removed while open is noticed
// and made anew; a corrupt file found at open is set aside and a fresh store made.
// Thread-safe: any thread may submit.

#include <chrono>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <sys/types.h>
#include <variant>
#include <vector>

#include "platform/linux/SqlitePendingRows.h"
#include "platform/linux/SqliteWrite.h"
#include "platform/linux/SqliteWriter.h"
#include "value/Value.h"

struct sqlite3;
struct sqlite3_stmt;

namespace mx {

// The time columns' unit: seconds since the Unix epoch.
double secondsSinceEpoch();

// How much a store keeps. Rows older than `maxAge` go, and while the rows take more
// than `maxBytes`, the oldest go; pruning runs on the writer thread between batches.
// Each step is a DELETE of up to a number of the oldest rows: for age, ?1 is the
// cutoff (seconds since the epoch) and ?2 the number; for size, ?1 the number. Steps
// run in order, so rows already exported go before those that are not; the rows of a
// step marked `unexported` are counted and logged as lost to export.
struct SqliteRetention {
    struct Step {
        std::string sql;
        bool unexported = false;
    };
    std::uint64_t maxBytes = 0;    // 0: no bound
    std::chrono::seconds maxAge{}; // 0: no bound
    std::vector<Step> olderThan;
    std::vector<Step> oldest;
    std::vector<std::string> tidy; // run after rows went, e.g. for rows that refer to them
    // The time of the first row written, when the steps by age find nothing before it:
    // they scan the table, and rows are written in the order of their time.
    std::string firstTime;
};

class SqliteStore {
public:
    // A batch stays short enough that a client held back by its rows gets room back
    // within a millisecond or two, not after a commit of thousands of rows.
    static constexpr std::size_t kBatchLimit = 256;
    // How long the writer lets a batch gather, from its first row or from the last
    // commit while rows keep coming, unless the batch fills first: at everyday rates a
    // transaction and its wake-ups cost far more than a row, so one commit a window
    // carries what the reports of the window left. Rows kept among the store's pending
    // rows (SqlitePendingRows) survive a SIGKILL, and gather for the long window: it
    // only bounds how late a reader sees them. A row that found no room there gathers
    // for the short one, which is what a SIGKILL may take of it, with the commit's own
    // time on top, and for a backend message the delivery's gathering before it: the
    // three stay under 100 ms.
    static constexpr std::chrono::milliseconds kBatchWindow{50};
    static constexpr std::chrono::milliseconds kKeptWindow{1000};
    // A row's JSON text is built in a buffer kept from row to row, unless it grew
    // past this.
    static constexpr std::size_t kTextKeptBytes = std::size_t{64} << 10;
    // Retries of a failing batch start this soon and slow down to the longest.
    static constexpr std::chrono::milliseconds kFirstRetry{100};
    static constexpr std::chrono::milliseconds kLongestRetry{5000};
    // How often the writer prunes by age, and how many rows one pruning transaction
    // removes: by age, many at a time; by size, few, so as not to overshoot a small
    // bound. A store past its size is pruned to 90% of it, not again at every batch.
    static constexpr std::chrono::seconds kPruneInterval{10};
    static constexpr std::int64_t kAgeChunk = 2000;
    static constexpr std::int64_t kSizeChunk = 100;
    // A store far past its limits is pruned over several rounds, this many rows a round
    // (a few milliseconds), so every store's rows wait at most that long for it.
    static constexpr std::int64_t kPruneRowsPerRound = 2000;
    // What a stored row takes beyond its parameters' bytes, and how much more its pages
    // and indexes take than that, at most: the size is asked for only when what the
    // rows may take by this reckoning could pass their share.
    static constexpr std::uint64_t kRowOverheadBytes = 64;
    static constexpr std::uint64_t kRowGrowthFactor = 2;
    static constexpr double kSizeLowWater = 0.9;
    // A store's byte bound holds its file and its write-ahead log together, as `du`
    // sees them: the log's share is a quarter of the bound, within these; the rows
    // get the rest.
    static constexpr std::uint64_t kSmallestLogShare = 128 << 10;
    static constexpr std::uint64_t kLargestLogShare = 4 << 20;
    static constexpr std::uint64_t kIndexBytes = 32 << 10; // the log's shared-memory index
    static constexpr std::uint64_t kPageBytes = 4096;
    // The log of a store without a size bound is checkpointed at SQLite's own mark.
    static constexpr int kUnboundedCheckpointPages = 1000;
    // A store is its owner's to write and its group's (audio) to read.
    static constexpr mode_t kFileMode = 0640;
    // How long a write waits for a reader (mxreport, the exporter) to let go.
    static constexpr int kBusyTimeoutMilliseconds = 5000;

    // Opens or creates the database, runs `schema`, prepares `statements`, and makes
    // sure it can write. A store that cannot be written now is made all the same, and
    // tries again on its retry schedule: the daemon serves meanwhile.
    static std::unique_ptr<SqliteStore> open(const std::filesystem::path& path, const std::vector<std::string>& schema,
                                             const std::vector<std::string>& statements, SqliteRetention retention);
    ~SqliteStore();
    SqliteStore(const SqliteStore&) = delete;
    SqliteStore& operator=(const SqliteStore&) = delete;

    // Charges the row to the account named on this thread (BacklogAccount), and keeps
    // it among the pending rows when there is room, before the caller answers anyone.
    void submit(SqliteWrite write);
    // Rows not committed: kept among the pending rows (the next start writes them in),
    // or in memory alone.
    struct Uncommitted {
        std::size_t kept = 0;
        std::size_t inMemory = 0;
        Uncommitted& operator+=(const Uncommitted& other)
        {
            kept += other.kept;
            inMemory += other.inMemory;
            return *this;
        }
    };
    // Waits until everything submitted before the call is committed, or `deadline`
    // passes: what is not committed then.
    Uncommitted flush(std::chrono::steady_clock::time_point deadline = std::chrono::steady_clock::time_point::max());

    // Runs a query on a connection of its own and returns the first column of the
    // first row as an integer (0 when there is none). For reading ids at start-up.
    std::int64_t queryInteger(const std::string& sql);

    const std::filesystem::path& path() const { return path_; }
    // From the next batch on, keep this much instead.
    void setRetention(SqliteRetention retention);
    // Called on the writer's thread after a commit that took a row wanted soon. Set
    // before rows come.
    void setCommittedSoon(std::function<void()> committed) { committedSoon_ = std::move(committed); }
    // "rows_written" (since start-up), "queue_depth" (rows waiting for the writer),
    // "bytes" (the file and its log on disk), "failures" (failed write attempts),
    // "pending_rows_in_memory" (the disk refused the file of pending rows: a crash
    // would lose the rows not yet committed).
    Dictionary status();

private:
    friend class SqliteWriter;

    // One open database file with its prepared statements. Writer thread only, once
    // the store runs.
    struct Connection {
        sqlite3* database = nullptr;
        std::vector<sqlite3_stmt*> statements;
        sqlite3_stmt* dataSize = nullptr; // the bytes the rows take
        sqlite3_stmt* begin = nullptr;
        sqlite3_stmt* commit = nullptr;
        sqlite3_stmt* markCommitted = nullptr; // the newest pending row committed
        dev_t device = 0;
        ino_t inode = 0;
    };

    SqliteStore(std::filesystem::path path, std::vector<std::string> schema, std::vector<std::string> statements,
                SqliteRetention retention, Connection connection);
    static bool connect(const std::filesystem::path& path, const std::vector<std::string>& schema,
                        const std::vector<std::string>& statements, Connection& connection, std::string& error,
                        int& code);
    static void disconnect(Connection& connection);
    void replayPending();

    // The writer's side. Under its lock:
    bool hasWork() const { return !queue_.empty() || !batch_.empty(); }
    bool anyHurried() const { return hurried_ > 0; }
    bool wantsRound() const;
    std::optional<std::chrono::steady_clock::time_point> retryAt() const;
    bool takeBatch(std::chrono::steady_clock::time_point now);
    bool queuedBeyondBatch() const { return !queue_.empty(); }
    void endRound();
    // Without it:
    void settleTaken();
    void writeBatch();
    void cutBackLog();

    bool stillOnDisk(std::string& error);
    bool commit(std::deque<SqliteWrite>& batch, std::string& error);
    int insert(SqliteWrite& write, std::uint64_t& bytes);
    void prune();
    std::uint64_t logShare() const;
    std::uint64_t rowsShare() const;
    void configureLog();
    void checkpointIfBehind();
    std::int64_t pruneStep(const SqliteRetention::Step& step, std::int64_t cutoff);
    bool anyOlderThan(std::int64_t cutoff);
    std::uint64_t dataBytes();
    bool rowsMayExceedShare();

    const std::filesystem::path path_;
    const std::vector<std::string> schema_;
    const std::vector<std::string> statementTexts_;
    const std::shared_ptr<SqliteWriter> writer_;
    std::function<void()> committedSoon_;

    // Writer thread only.
    SqliteRetention retention_;
    bool logConfigured_ = false;                      // the log's bounds match retention_
    int checkpointPages_ = kUnboundedCheckpointPages; // the log's mark
    int logPages_ = 0;                                // in the log after the last commit
    Connection connection_;
    std::vector<std::string> texts_; // each parameter's JSON text for the row at hand
    std::chrono::steady_clock::time_point lastPrune_{};
    bool pruneUnfinished_ = false; // the last pruning stopped at its budget
    std::int64_t prunedRows_ = 0;  // since the pruning began, logged when it ends
    std::int64_t prunedUnexported_ = 0;
    // What the rows took when last asked (nothing: ask at once), and what the batches
    // since bound and stepped.
    std::optional<std::uint64_t> measuredBytes_;
    std::uint64_t unmeasuredBytes_ = 0;
    // The batch at hand, kept while it fails, and how its attempts went.
    std::deque<SqliteWrite> batch_;
    std::size_t queuedBehind_ = 0; // rows queued behind it when it was taken or retried
    bool giveUp_ = false;          // the store closes: a second failure abandons the batch
    std::uint64_t attempts_ = 0;
    std::chrono::milliseconds retryDelay_ = kFirstRetry;
    std::chrono::steady_clock::time_point retryAt_{};
    std::chrono::steady_clock::time_point failingSince_{};
    std::uint64_t committedPending_ = 0; // the newest pending row committed
    std::size_t refused_ = 0;            // rows of the last commit the store refused
    std::size_t committedRows_ = 0;      // from the front of the batch, by the last commit
    std::uint64_t roundPending_ = 0;     // the same, once the round ends
    std::uint64_t roundWritten_ = 0;
    std::uint64_t roundSettled_ = 0; // written or abandoned
    std::uint64_t roundFailures_ = 0;
    bool roundCheckpoint_ = false; // the log passed its mark

    // Under the writer's lock.
    std::unique_ptr<SqlitePendingRows> pending_; // set at open, nothing: no row is kept
    std::optional<SqliteRetention> newRetention_;
    std::deque<SqliteWrite> queue_;
    // Rows in the queue that want the short window: not kept among the pending rows, or
    // wanted soon by a reader.
    std::size_t hurried_ = 0;
    std::uint64_t submitted_ = 0;
    std::uint64_t committed_ = 0;
    std::uint64_t settled_ = 0; // committed, or abandoned by a store closing on a failing disk
    std::uint64_t failures_ = 0;
    bool closing_ = false;
};

} // namespace mx
