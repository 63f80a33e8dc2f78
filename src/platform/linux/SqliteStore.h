#pragma once
// An embedded SQLite store written in batches on a writer thread of its own. Callers
// hand over rows and go on; they wait only while the bounded queue in front of the
// writer is full, so nothing is ever dropped. WAL journaling keeps every committed
// batch across a crash; destruction commits everything handed over before.
// Thread-safe: any thread may submit.

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <variant>
#include <vector>

#include "platform/UniqueFunction.h"
#include "platform/Value.h"

struct sqlite3;
struct sqlite3_stmt;

namespace mx {

// The time columns' unit: seconds since the Unix epoch.
double secondsSinceEpoch();

// A Dictionary parameter is written as its JSON text, and a deferred one is built
// first: both happen on the writer thread, off the caller's path.
using SqliteDeferredDictionary = std::shared_ptr<UniqueFunction<Dictionary()>>;
using SqliteValue =
    std::variant<std::nullptr_t, std::int64_t, double, std::string, Dictionary, SqliteDeferredDictionary>;

struct SqliteWrite {
    std::size_t statement; // index into the statements given at open
    std::vector<SqliteValue> parameters;
};

class SqliteStore {
public:
    static constexpr std::size_t kQueueBound = 65536;
    static constexpr std::size_t kBatchLimit = 4096;
    // How long the writer lets a batch gather once the first row of it arrived: a
    // thousand rows a millisecond cost one transaction and one wake-up, not a thousand.
    static constexpr std::chrono::milliseconds kBatchWindow{2};

    // Opens or creates the database, runs `schema`, prepares `statements`. Nothing,
    // with `error`, when any of that fails.
    static std::unique_ptr<SqliteStore> open(const std::filesystem::path& path, const std::vector<std::string>& schema,
                                             const std::vector<std::string>& statements, std::string& error);
    ~SqliteStore();
    SqliteStore(const SqliteStore&) = delete;
    SqliteStore& operator=(const SqliteStore&) = delete;

    void submit(SqliteWrite write);
    // Waits until everything submitted before the call is committed.
    void flush();

    // Runs a query on a connection of its own and returns the first column of the
    // first row as an integer (0 when there is none). For reading ids at start-up.
    std::int64_t queryInteger(const std::string& sql);

    const std::filesystem::path& path() const { return path_; }

private:
    SqliteStore(std::filesystem::path path, sqlite3* database, std::vector<sqlite3_stmt*> statements);
    void run();
    void commit(std::deque<SqliteWrite>& batch);

    std::filesystem::path path_;
    sqlite3* database_;
    std::vector<sqlite3_stmt*> statements_;

    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<SqliteWrite> queue_;
    std::uint64_t submitted_ = 0;
    std::uint64_t committed_ = 0;
    bool stopping_ = false;
    bool writerWaiting_ = false;
    std::thread writer_;
};

} // namespace mx
