#include "platform/linux/SqliteStore.h"

#include <chrono>
#include <pthread.h>
#include <sqlite3.h>

#include "platform/JsonValue.h"
#include "platform/MxLog.h"

namespace mx {

double secondsSinceEpoch()
{
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::unique_ptr<SqliteStore> SqliteStore::open(const std::filesystem::path& path,
                                               const std::vector<std::string>& schema,
                                               const std::vector<std::string>& statements, std::string& error)
{
    std::error_code ignored;
    std::filesystem::create_directories(path.parent_path(), ignored);
    sqlite3* database = nullptr;
    if (sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                        nullptr) != SQLITE_OK) {
        error = "cannot open " + path.string() + ": " + (database ? sqlite3_errmsg(database) : "out of memory");
        sqlite3_close(database);
        return nullptr;
    }
    sqlite3_busy_timeout(database, 5000);
    std::vector<std::string> setup = {"PRAGMA journal_mode=WAL", "PRAGMA synchronous=NORMAL"};
    setup.insert(setup.end(), schema.begin(), schema.end());
    for (const auto& sql : setup) {
        char* message = nullptr;
        if (sqlite3_exec(database, sql.c_str(), nullptr, nullptr, &message) != SQLITE_OK) {
            error = path.string() + ": " + (message ? message : "error") + " in: " + sql;
            sqlite3_free(message);
            sqlite3_close(database);
            return nullptr;
        }
    }
    std::vector<sqlite3_stmt*> prepared;
    for (const auto& sql : statements) {
        sqlite3_stmt* statement = nullptr;
        if (sqlite3_prepare_v3(database, sql.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr) !=
            SQLITE_OK) {
            error = path.string() + ": " + sqlite3_errmsg(database) + " in: " + sql;
            for (auto* done : prepared)
                sqlite3_finalize(done);
            sqlite3_close(database);
            return nullptr;
        }
        prepared.push_back(statement);
    }
    return std::unique_ptr<SqliteStore>(new SqliteStore(path, database, std::move(prepared)));
}

SqliteStore::SqliteStore(std::filesystem::path path, sqlite3* database, std::vector<sqlite3_stmt*> statements)
    : path_(std::move(path)), database_(database), statements_(std::move(statements))
{
    writer_ = std::thread([this] {
        pthread_setname_np(pthread_self(), "mx-store");
        run();
    });
}

SqliteStore::~SqliteStore()
{
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    changed_.notify_all();
    writer_.join();
    for (auto* statement : statements_)
        sqlite3_finalize(statement);
    sqlite3_close(database_);
}

void SqliteStore::submit(SqliteWrite write)
{
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [&] { return queue_.size() < kQueueBound || stopping_; });
    queue_.push_back(std::move(write));
    ++submitted_;
    if (writerWaiting_)
        changed_.notify_all();
}

void SqliteStore::flush()
{
    std::unique_lock lock(mutex_);
    std::uint64_t target = submitted_;
    changed_.notify_all();
    changed_.wait(lock, [&] { return committed_ >= target; });
}

void SqliteStore::run()
{
    std::unique_lock lock(mutex_);
    for (;;) {
        writerWaiting_ = true;
        changed_.wait(lock, [&] { return !queue_.empty() || stopping_; });
        writerWaiting_ = false;
        if (queue_.empty() && stopping_)
            return;
        if (!stopping_ && queue_.size() < kBatchLimit) {
            lock.unlock();
            std::this_thread::sleep_for(kBatchWindow);
            lock.lock();
        }
        std::deque<SqliteWrite> batch;
        while (!queue_.empty() && batch.size() < kBatchLimit) {
            batch.push_back(std::move(queue_.front()));
            queue_.pop_front();
        }
        changed_.notify_all(); // room in the queue again
        lock.unlock();
        commit(batch);
        lock.lock();
        committed_ += batch.size();
        changed_.notify_all();
    }
}

void SqliteStore::commit(std::deque<SqliteWrite>& batch)
{
    // A write that fails (a full disk, a broken file) is logged; the rest of the batch
    // still commits.
    sqlite3_exec(database_, "BEGIN", nullptr, nullptr, nullptr);
    for (auto& write : batch) {
        sqlite3_stmt* statement = statements_[write.statement];
        for (std::size_t i = 0; i < write.parameters.size(); ++i) {
            int index = static_cast<int>(i) + 1;
            std::visit(
                [&](const auto& value) {
                    using T = std::decay_t<decltype(value)>;
                    if constexpr (std::is_same_v<T, std::nullptr_t>)
                        sqlite3_bind_null(statement, index);
                    else if constexpr (std::is_same_v<T, std::int64_t>)
                        sqlite3_bind_int64(statement, index, value);
                    else if constexpr (std::is_same_v<T, double>)
                        sqlite3_bind_double(statement, index, value);
                    else if constexpr (std::is_same_v<T, std::string>)
                        sqlite3_bind_text(statement, index, value.data(), static_cast<int>(value.size()),
                                          SQLITE_STATIC);
                    else if constexpr (std::is_same_v<T, Dictionary>) {
                        std::string text = toJsonText(value);
                        sqlite3_bind_text(statement, index, text.data(), static_cast<int>(text.size()),
                                          SQLITE_TRANSIENT);
                    } else {
                        std::string text = toJsonText((*value)());
                        sqlite3_bind_text(statement, index, text.data(), static_cast<int>(text.size()),
                                          SQLITE_TRANSIENT);
                    }
                },
                write.parameters[i]);
        }
        if (sqlite3_step(statement) != SQLITE_DONE)
            MXLOG(nullptr, Error, "{}: write failed: {}", path_.string(), sqlite3_errmsg(database_));
        sqlite3_reset(statement);
        sqlite3_clear_bindings(statement);
    }
    if (sqlite3_exec(database_, "COMMIT", nullptr, nullptr, nullptr) != SQLITE_OK)
        MXLOG(nullptr, Error, "{}: commit failed: {}", path_.string(), sqlite3_errmsg(database_));
}

std::int64_t SqliteStore::queryInteger(const std::string& sql)
{
    sqlite3* reader = nullptr;
    std::int64_t result = 0;
    if (sqlite3_open_v2(path_.c_str(), &reader, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
        sqlite3_stmt* statement = nullptr;
        if (sqlite3_prepare_v2(reader, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK &&
            sqlite3_step(statement) == SQLITE_ROW)
            result = sqlite3_column_int64(statement, 0);
        sqlite3_finalize(statement);
    }
    sqlite3_close(reader);
    return result;
}

} // namespace mx
