#include "platform/linux/SqliteStore.h"

#include <algorithm>
#include <chrono>
#include <ctime>
#include <fcntl.h>
#include <limits>
#include <sys/stat.h>
#include <system_error>
#include <unistd.h>

#include <fmt/format.h>
#include <sqlite3.h>

#include "platform/MxLog.h"
#include "platform/linux/PosixFileSystem.h"
#include "value/JsonValue.h"

namespace mx {

double secondsSinceEpoch()
{
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

namespace {

std::string errnoText(int error) { return std::generic_category().message(error); }

bool isCorruption(int code) { return code == SQLITE_CORRUPT || code == SQLITE_NOTADB; }

// A failure that belongs to the row itself rather than to the store or its disk.
bool refusesRow(int stepped)
{
    int code = stepped & 0xff;
    return code == SQLITE_CONSTRAINT || code == SQLITE_MISMATCH || code == SQLITE_TOOBIG || code == SQLITE_RANGE;
}

// A row's parameters for the log, cut short: enough to find it by.
std::string describeRow(const SqliteWrite& write)
{
    constexpr std::size_t kShown = 512;
    std::string text = "[";
    for (const auto& parameter : write.parameters) {
        if (text.size() > 1)
            text += ", ";
        std::visit(
            [&](const auto& value) {
                using T = std::decay_t<decltype(value)>;
                if constexpr (std::is_same_v<T, std::nullptr_t>)
                    text += "null";
                else if constexpr (std::is_same_v<T, std::int64_t> || std::is_same_v<T, double>)
                    text += fmt::format("{}", value);
                else if constexpr (std::is_same_v<T, std::string> || std::is_same_v<T, Dictionary>)
                    appendJsonText(text, Value(value));
                else
                    text += "(deferred)";
            },
            parameter);
        if (text.size() > kShown)
            return text.substr(0, kShown) + "...";
    }
    return text + "]";
}

// Every store says up to which of its pending rows it has committed, in the
// transaction that commits them.
constexpr const char* kPendingTable =
    "CREATE TABLE IF NOT EXISTS pending_committed(id INTEGER PRIMARY KEY CHECK (id = 1), sequence INTEGER NOT NULL)";

// The first column of the first row as an integer, 0 when there is none.
std::int64_t firstInteger(sqlite3* database, const std::string& sql)
{
    sqlite3_stmt* statement = nullptr;
    std::int64_t result = 0;
    if (sqlite3_prepare_v2(database, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK &&
        sqlite3_step(statement) == SQLITE_ROW)
        result = sqlite3_column_int64(statement, 0);
    sqlite3_finalize(statement);
    return result;
}

// "tally.db" -> "tally.db.corrupt-20261123T041500", with its journal files beside it.
std::filesystem::path setAside(const std::filesystem::path& path)
{
    std::time_t now = std::time(nullptr);
    std::tm local{};
    localtime_r(&now, &local);
    char stamp[32];
    std::strftime(stamp, sizeof(stamp), "%Y%m%dT%H%M%S", &local);
    std::filesystem::path aside = path.string() + ".corrupt-" + stamp;
    std::error_code ignored;
    for (const char* suffix : {"", "-wal", "-shm"})
        std::filesystem::rename(path.string() + suffix, aside.string() + suffix, ignored);
    return aside;
}

std::string describe(std::chrono::steady_clock::duration duration)
{
    return fmt::format("{:.1f} s", std::chrono::duration<double>(duration).count());
}

// A new store's file is made here, with its mode set on the descriptor whatever the
// umask; SQLite gives its log and the log's index the same. An existing one is kept.
std::optional<std::string> makeFile(const std::filesystem::path& path)
{
    if (auto failure = PosixFileSystem::makeDirectories(path.parent_path(), PosixFileSystem::kDaemonDirectoryMode))
        return "cannot make its directory: " + *failure;
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, SqliteStore::kFileMode);
    if (fd < 0) {
        int error = errno;
        if (error == EEXIST)
            return std::nullopt;
        return "cannot make it: " + errnoText(error) + PosixFileSystem::refusalHint(error, path.parent_path());
    }
    bool set = ::fchmod(fd, SqliteStore::kFileMode) == 0;
    int failure = errno;
    ::close(fd);
    if (!set)
        return "cannot set its mode: " + errnoText(failure);
    return std::nullopt;
}

} // namespace

std::unique_ptr<SqliteStore> SqliteStore::open(const std::filesystem::path& path,
                                               const std::vector<std::string>& schema,
                                               const std::vector<std::string>& statements, SqliteRetention retention)
{
    // SQLite counts every allocation under a process-wide mutex unless told not
    // to, and three writers allocating for every row contend on it. Too late once
    // another part of the process set SQLite up, which only costs the counting.
    [[maybe_unused]] static const int configured = sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0);
    Connection connection;
    int code = SQLITE_OK;
    std::string error;
    if (!connect(path, schema, statements, connection, error, code) && isCorruption(code)) {
        auto aside = setAside(path);
        MXLOG_LIMITED(nullptr, Error, "{} is corrupt ({}): set aside as {}, starting a fresh store", path.string(),
                      error, aside.filename().string());
        connect(path, schema, statements, connection, error, code);
    }
    // A store that cannot be written now (a full or read-only disk) serves all the
    // same: its rows wait for it, and it tries again on its retry schedule.
    if (!connection.database)
        MXLOG_LIMITED(nullptr, Error, "{}; serving all the same: its rows wait until it can be written", error);
    std::unique_ptr<SqliteStore> store(new SqliteStore(path, schema, statements, std::move(retention), connection));
    store->replayPending();
    std::lock_guard lock(store->writer_->mutex());
    store->writer_->attach(*store);
    return store;
}

// Rows answered but not committed when the process last ended go first, before any
// other, from the file that keeps them until they are committed. Without the file,
// rows are kept in memory alone (a disk that refuses it), and the log says so.
void SqliteStore::replayPending()
{
    auto path = path_.native() + "-pending";
    std::string why;
    pending_ = SqlitePendingRows::open(path, path_.filename().string(), why);
    if (!pending_) {
        MXLOG_LIMITED(nullptr, Error,
                      "{}: {}; rows answered until the store takes them are kept in memory alone, and a crash "
                      "would lose them",
                      path, why);
        return;
    }
    // Read on a connection of its own, so that a store that cannot be written still
    // tells which of the rows it holds.
    auto committed = static_cast<std::uint64_t>(queryInteger("SELECT sequence FROM pending_committed"));
    auto replayed = pending_->rowsAfter(committed, statementTexts_.size());
    committedPending_ = committed;
    if (replayed.empty())
        return;
    std::deque<SqliteWrite> rows(std::make_move_iterator(replayed.begin()), std::make_move_iterator(replayed.end()));
    std::string failure;
    std::size_t written = 0;
    std::size_t refused = 0;
    while (!rows.empty() && connection_.database && commit(rows, failure)) {
        written += committedRows_ - refused_;
        refused += refused_;
        rows.erase(rows.begin(), rows.begin() + static_cast<std::ptrdiff_t>(committedRows_));
    }
    if (written + refused > 0)
        pending_->release(committedPending_);
    if (rows.empty()) {
        MXLOG_LIMITED(nullptr, Default, "{}: wrote the {} answered rows kept in {} since the last run{}",
                      path_.string(), written, path,
                      refused > 0 ? fmt::format(" ({} refused, set aside)", refused) : "");
        return;
    }
    // They stay kept, and go first once the store can take them.
    MXLOG_LIMITED(nullptr, Error,
                  "{}: cannot write the {} answered rows kept in {} now ({}): they go first once it can",
                  path_.string(), rows.size(), path, connection_.database ? failure : "the store cannot be written");
    for (auto& row : rows) {
        queue_.push_back(std::move(row));
        ++submitted_;
    }
}

bool SqliteStore::connect(const std::filesystem::path& path, const std::vector<std::string>& schema,
                          const std::vector<std::string>& statements, Connection& connection, std::string& error,
                          int& code)
{
    auto fail = [&](const std::string& what) {
        code = connection.database ? sqlite3_extended_errcode(connection.database) & 0xff : SQLITE_CANTOPEN;
        error = path.string() + ": " + what;
        disconnect(connection);
        return false;
    };
    if (auto failure = makeFile(path))
        return fail(*failure);
    if (sqlite3_open_v2(path.c_str(), &connection.database,
                        SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr) != SQLITE_OK)
        return fail(
            std::string("cannot open: ") +
            (connection.database ? sqlite3_errmsg(connection.database) : "out of memory") +
            PosixFileSystem::refusalHint(connection.database ? sqlite3_system_errno(connection.database) : 0, path));
    sqlite3_busy_timeout(connection.database, kBusyTimeoutMilliseconds);
    // The last step proves that the store can be written, not just read.
    // A new store gives pruned pages back to the file system; an older one reuses them.
    std::vector<std::string> setup = {"PRAGMA auto_vacuum=INCREMENTAL", "PRAGMA journal_mode=WAL",
                                      "PRAGMA synchronous=NORMAL", "PRAGMA cache_size=-512", kPendingTable};
    setup.insert(setup.end(), schema.begin(), schema.end());
    setup.insert(setup.end(), {"BEGIN IMMEDIATE", "COMMIT"});
    for (const auto& sql : setup) {
        char* message = nullptr;
        if (sqlite3_exec(connection.database, sql.c_str(), nullptr, nullptr, &message) != SQLITE_OK) {
            std::string text = message ? message : "error";
            sqlite3_free(message);
            text += " in: ";
            text += sql;
            return fail(text);
        }
    }
    if (sqlite3_db_readonly(connection.database, "main") == 1)
        return fail("cannot be written");
    for (const auto& sql : statements) {
        sqlite3_stmt* statement = nullptr;
        if (sqlite3_prepare_v3(connection.database, sql.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr) !=
            SQLITE_OK)
            return fail(std::string(sqlite3_errmsg(connection.database)) + " in: " + sql);
        connection.statements.push_back(statement);
    }
    // Asked after every batch of a store with a size bound: prepared once.
    if (sqlite3_prepare_v3(connection.database,
                           "SELECT max(0, page_count - freelist_count) * page_size "
                           "FROM pragma_page_count(), pragma_freelist_count(), pragma_page_size()",
                           -1, SQLITE_PREPARE_PERSISTENT, &connection.dataSize, nullptr) != SQLITE_OK)
        return fail(std::string(sqlite3_errmsg(connection.database)) + " in the size query");
    // Every batch begins and commits, and most say which pending rows they took: parsed once.
    auto prepare = [&](const char* sql, sqlite3_stmt** statement) {
        return sqlite3_prepare_v3(connection.database, sql, -1, SQLITE_PREPARE_PERSISTENT, statement, nullptr) ==
            SQLITE_OK;
    };
    if (!prepare("BEGIN", &connection.begin) || !prepare("COMMIT", &connection.commit) ||
        !prepare("REPLACE INTO pending_committed(id, sequence) VALUES(1, ?)", &connection.markCommitted))
        return fail(std::string(sqlite3_errmsg(connection.database)) + " in preparing a transaction");
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0)
        return fail("vanished as it was opened");
    connection.device = status.st_dev;
    connection.inode = status.st_ino;
    return true;
}

void SqliteStore::disconnect(Connection& connection)
{
    for (auto* statement : connection.statements)
        sqlite3_finalize(statement);
    connection.statements.clear();
    for (auto** statement : {&connection.dataSize, &connection.begin, &connection.commit, &connection.markCommitted}) {
        sqlite3_finalize(*statement);
        *statement = nullptr;
    }
    sqlite3_close(connection.database);
    connection.database = nullptr;
}

SqliteStore::SqliteStore(std::filesystem::path path, std::vector<std::string> schema,
                         std::vector<std::string> statements, SqliteRetention retention, Connection connection)
    : path_(std::move(path)),
      schema_(std::move(schema)),
      statementTexts_(std::move(statements)),
      writer_(SqliteWriter::shared()),
      retention_(std::move(retention)),
      connection_(std::move(connection))
{
}

SqliteStore::~SqliteStore()
{
    {
        std::unique_lock lock(writer_->mutex());
        closing_ = true;
        writer_->hurry();
        writer_->changed().wait(lock, [&] { return settled_ == submitted_; });
        writer_->detach(*this, lock);
    }
    disconnect(connection_);
}

void SqliteStore::submit(SqliteWrite write)
{
    write.debt = BacklogDebt::incur();
    // A client held back waits on its rows: they go now, not at the window's end.
    bool urgent = write.debt.overdrawn();
    // Encoded before the lock is taken; a full file of pending rows is not tried. Its
    // last quarter is kept for the clients that owe little: one that fills the queues
    // (its rows outrunning the writer, or a disk refusing them) waits for commits once
    // the rest is taken, and the others go on being answered at once.
    std::string_view encoded;
    if (pending_ && pending_->mayHaveRoom() && !(pending_->mostlyTaken() && write.debt.owesMuch()))
        encoded = SqlitePendingRows::encode(write);
    // A row kept nowhere holds its request's reply until it is committed; without a
    // file to keep rows in (a disk that refused it), rows are answered from memory.
    if (encoded.empty() && pending_)
        write.ticket = ReplyTicket::take();
    std::lock_guard lock(writer_->mutex());
    if (!encoded.empty())
        write.pending = pending_->keep(encoded);
    bool kept = write.pending != 0;
    bool soon = write.soon;
    if (!kept && !write.ticket && pending_)
        write.ticket = ReplyTicket::take();
    if (!kept || soon)
        ++hurried_;
    // A reply waiting on the row wants it committed now, not at the window's end.
    urgent |= static_cast<bool>(write.ticket);
    queue_.push_back(std::move(write));
    ++submitted_;
    if (urgent)
        writer_->hurry();
    else
        writer_->queued(queue_.size(), kept && !soon && !pending_->halfTaken());
}

SqliteStore::Uncommitted SqliteStore::flush(std::chrono::steady_clock::time_point deadline)
{
    std::unique_lock lock(writer_->mutex());
    std::uint64_t target = submitted_;
    if (settled_ < target)
        writer_->hurry();
    if (writer_->changed().wait_until(lock, deadline, [&] { return settled_ >= target; }))
        return {};
    Uncommitted left;
    for (const auto* rows : {&batch_, &queue_})
        for (const auto& write : *rows)
            ++(write.pending != 0 ? left.kept : left.inMemory);
    return left;
}

// A full batch goes before its window ends; a failing one waits for its retry, unless
// the store closes.
bool SqliteStore::wantsRound() const
{
    if (batch_.empty())
        return queue_.size() >= kBatchLimit;
    return closing_;
}

std::optional<std::chrono::steady_clock::time_point> SqliteStore::retryAt() const
{
    if (batch_.empty())
        return std::nullopt;
    return retryAt_;
}

bool SqliteStore::takeBatch(std::chrono::steady_clock::time_point now)
{
    if (batch_.empty()) {
        if (queue_.empty())
            return false;
        if (newRetention_) {
            retention_ = *std::exchange(newRetention_, std::nullopt);
            logConfigured_ = false;
        }
        while (!queue_.empty() && batch_.size() < kBatchLimit) {
            if (queue_.front().pending == 0 || queue_.front().soon)
                --hurried_;
            batch_.push_back(std::move(queue_.front()));
            queue_.pop_front();
        }
    } else if (!closing_ && now < retryAt_) {
        return false;
    }
    queuedBehind_ = queue_.size();
    giveUp_ = closing_;
    return true;
}

void SqliteStore::endRound()
{
    if (std::exchange(roundCheckpoint_, false))
        writer_->checkpoint(path_);
    if (auto committed = std::exchange(roundPending_, 0); committed != 0 && pending_)
        pending_->release(committed);
    committed_ += std::exchange(roundWritten_, 0);
    settled_ += std::exchange(roundSettled_, 0);
    failures_ += std::exchange(roundFailures_, 0);
}

// A batch is bounded by its own limit, so its rows need not stay on their clients'
// accounts: what a client owes covers what waits behind the batches, and its room
// comes back as soon as the writer takes its rows, not a commit later.
void SqliteStore::settleTaken()
{
    for (auto& write : batch_)
        write.debt = {};
}

// One attempt at the batch at hand.
void SqliteStore::writeBatch()
{
    auto now = std::chrono::steady_clock::now();
    std::string error;
    bool present = stillOnDisk(error);
    if (present && !logConfigured_)
        configureLog();
    if (present)
        checkpointIfBehind();
    if (present && commit(batch_, error)) {
        if (attempts_ > 0)
            MXLOG_LIMITED(nullptr, Default, "{}: writing again after {} failed attempts in {}", path_.string(),
                          attempts_, describe(now - failingSince_));
        attempts_ = 0;
        retryDelay_ = kFirstRetry;
        roundWritten_ = committedRows_ - refused_;
        roundSettled_ = committedRows_;
        roundPending_ = committedPending_;
        // A store with a size bound moves its log into its file itself, now: another
        // connection checkpointing beside it would hold a snapshot now and then, and the
        // log could not start again.
        if (retention_.maxBytes > 0)
            checkpointIfBehind();
        roundCheckpoint_ = retention_.maxBytes == 0 && logPages_ >= checkpointPages_;
        bool soon = false;
        auto committedEnd = batch_.begin() + static_cast<std::ptrdiff_t>(committedRows_);
        for (auto write = batch_.begin(); write != committedEnd; ++write) {
            write->ticket.giveBack();
            soon |= write->soon;
        }
        batch_.erase(batch_.begin(), committedEnd);
        // What a transaction's bytes left over goes next, at once.
        retryAt_ = now;
        if (soon && committedSoon_)
            committedSoon_();
        // Age is looked at now and then; size after any batch that may have taken the
        // rows past their share, so that a burst never takes the store far past its bound;
        // and a pruning cut short at its budget goes on.
        if (std::chrono::steady_clock::now() - lastPrune_ >= kPruneInterval || pruneUnfinished_ || rowsMayExceedShare())
            prune();
        return;
    }
    ++roundFailures_;
    if (attempts_++ == 0) {
        failingSince_ = now;
        MXLOG_LIMITED(nullptr, Error,
                      "{}: cannot write ({}); holding {} rows and retrying: the clients that sent them wait until it "
                      "can write again",
                      path_.string(), error, batch_.size() + queuedBehind_);
    }
    // Only a store being closed gives up, and says what it could not keep.
    if (giveUp_ && attempts_ > 1) {
        MXLOG_LIMITED(nullptr, Error, "{}: closing with {} rows that could not be written: {}", path_.string(),
                      batch_.size() + queuedBehind_, error);
        roundSettled_ = batch_.size();
        batch_.clear();
        attempts_ = 0;
        retryDelay_ = kFirstRetry;
        return;
    }
    retryAt_ = now + retryDelay_;
    retryDelay_ = std::min(retryDelay_ * 2, kLongestRetry);
}

// A batch larger than the log's share takes the log past it until the log starts
// again, which may be long for a store gone quiet: once the queue is empty, the log
// is moved into the file and cut to nothing.
void SqliteStore::cutBackLog()
{
    if (retention_.maxBytes == 0 || !connection_.database)
        return;
    struct stat log {};
    if (::stat((path_.native() + "-wal").c_str(), &log) != 0 ||
        static_cast<std::uint64_t>(log.st_size) <= logShare() - kIndexBytes)
        return;
    // A reader in the way is not waited for: the next quiet moment tries again.
    sqlite3_busy_timeout(connection_.database, 0);
    sqlite3_wal_checkpoint_v2(connection_.database, nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
    sqlite3_busy_timeout(connection_.database, kBusyTimeoutMilliseconds);
}

std::uint64_t SqliteStore::logShare() const
{
    return std::clamp(retention_.maxBytes / 4, kSmallestLogShare, kLargestLogShare);
}

std::uint64_t SqliteStore::rowsShare() const
{
    return retention_.maxBytes > logShare() ? retention_.maxBytes - logShare() : retention_.maxBytes / 2;
}

// The log is checkpointed into the file once it holds half of what its share leaves
// beside the shared-memory index, and cut back to that when it starts again: a batch
// committed past it, before the checkpoint, still fits in the share. The checkpoint
// runs beside the writer (SqliteWriter): it waits on the disk twice, and every store's
// rows would wait with it. A log that reaches twice its mark, the checkpoints falling
// behind, is checkpointed here, before the next batch.
void SqliteStore::configureLog()
{
    logConfigured_ = true;
    if (!connection_.database)
        return;
    checkpointPages_ = kUnboundedCheckpointPages;
    if (retention_.maxBytes > 0) {
        std::uint64_t limit = (logShare() - kIndexBytes) / 2;
        checkpointPages_ = static_cast<int>(std::max<std::uint64_t>(1, limit / kPageBytes));
        sqlite3_exec(connection_.database, fmt::format("PRAGMA journal_size_limit={}", limit).c_str(), nullptr, nullptr,
                     nullptr);
    }
    // Replaces SQLite's own checkpoint after commits.
    sqlite3_wal_hook(
        connection_.database,
        [](void* self, sqlite3*, const char*, int pages) {
            static_cast<SqliteStore*>(self)->logPages_ = pages;
            return SQLITE_OK;
        },
        this);
}

// A store with a size bound moves its log into its file here, after the commit that
// took the log past its mark: what the database, its log and its pending rows take
// together then stays within twice the bound at every moment, a burst included. One
// without a bound leaves it to the checkpointing thread until the log reaches twice
// its mark, the checkpoints falling behind.
void SqliteStore::checkpointIfBehind()
{
    if (logPages_ < (retention_.maxBytes > 0 ? checkpointPages_ : 2 * checkpointPages_))
        return;
    sqlite3_wal_checkpoint_v2(connection_.database, nullptr, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
    logPages_ = 0;
}

std::uint64_t SqliteStore::dataBytes()
{
    std::int64_t bytes = 0;
    if (sqlite3_step(connection_.dataSize) == SQLITE_ROW)
        bytes = sqlite3_column_int64(connection_.dataSize, 0);
    sqlite3_reset(connection_.dataSize);
    measuredBytes_ = static_cast<std::uint64_t>(bytes);
    unmeasuredBytes_ = 0;
    return *measuredBytes_;
}

// The three page counts are asked for only when the rows written since they were last
// asked for could, grown by their pages and indexes, have passed the share.
bool SqliteStore::rowsMayExceedShare()
{
    if (retention_.maxBytes == 0 || !connection_.database)
        return false;
    if (measuredBytes_ && *measuredBytes_ + kRowGrowthFactor * unmeasuredBytes_ <= rowsShare())
        return false;
    return dataBytes() > rowsShare();
}

// Rows removed by one step in one transaction, or -1 when it failed.
std::int64_t SqliteStore::pruneStep(const SqliteRetention::Step& step, std::int64_t cutoff)
{
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(connection_.database, step.sql.c_str(), -1, &statement, nullptr) != SQLITE_OK) {
        MXLOG_LIMITED(nullptr, Error, "{}: cannot prune: {}", path_.string(), sqlite3_errmsg(connection_.database));
        return -1;
    }
    if (cutoff != 0) {
        sqlite3_bind_int64(statement, 1, cutoff);
        sqlite3_bind_int64(statement, 2, kAgeChunk);
    } else {
        sqlite3_bind_int64(statement, 1, kSizeChunk);
    }
    int stepped = sqlite3_step(statement);
    sqlite3_finalize(statement);
    if (stepped != SQLITE_DONE)
        return -1;
    return sqlite3_changes(connection_.database);
}

bool SqliteStore::anyOlderThan(std::int64_t cutoff)
{
    if (retention_.firstTime.empty())
        return true;
    sqlite3_stmt* statement = nullptr;
    bool older = true;
    if (sqlite3_prepare_v2(connection_.database, retention_.firstTime.c_str(), -1, &statement, nullptr) == SQLITE_OK)
        older = sqlite3_step(statement) == SQLITE_ROW && sqlite3_column_double(statement, 0) < double(cutoff);
    sqlite3_finalize(statement);
    return older;
}

void SqliteStore::prune()
{
    lastPrune_ = std::chrono::steady_clock::now();
    if (!connection_.database)
        return;
    std::int64_t budget = kPruneRowsPerRound;
    std::int64_t pruned = 0;
    auto run = [&](const SqliteRetention::Step& step, std::int64_t cutoff) {
        std::int64_t removed = pruneStep(step, cutoff);
        if (removed > 0) {
            pruned += removed;
            budget -= removed;
            if (step.unexported)
                prunedUnexported_ += removed;
        }
        return removed;
    };
    if (retention_.maxAge.count() > 0) {
        auto cutoff = static_cast<std::int64_t>(secondsSinceEpoch()) - retention_.maxAge.count();
        if (anyOlderThan(cutoff))
            for (const auto& step : retention_.olderThan)
                while (budget > 0 && run(step, cutoff) == kAgeChunk) {}
    }
    if (retention_.maxBytes > 0)
        while (budget > 0 && static_cast<double>(dataBytes()) > kSizeLowWater * static_cast<double>(rowsShare())) {
            bool removedAny = false;
            for (const auto& step : retention_.oldest)
                if (run(step, 0) > 0) {
                    removedAny = true;
                    break;
                }
            if (!removedAny)
                break;
        }
    pruneUnfinished_ = budget <= 0;
    if (pruned == 0)
        return;
    prunedRows_ += pruned;
    for (const auto& sql : retention_.tidy)
        sqlite3_exec(connection_.database, sql.c_str(), nullptr, nullptr, nullptr);
    // The pages the rows gave up go back to the file system, and the log that holds the
    // deletions goes into the file, to be cut back when it starts again.
    sqlite3_exec(connection_.database, "PRAGMA incremental_vacuum", nullptr, nullptr, nullptr);
    if (retention_.maxBytes > 0) {
        sqlite3_wal_checkpoint_v2(connection_.database, nullptr, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
        logPages_ = 0;
    } else {
        roundCheckpoint_ = true;
    }
    if (pruneUnfinished_)
        return;
    MXLOG_LIMITED(nullptr, Default, "{}: pruned {} rows beyond its limits", path_.string(),
                  std::exchange(prunedRows_, 0));
    if (auto unexported = std::exchange(prunedUnexported_, 0); unexported > 0)
        MXLOG_LIMITED(nullptr, Error, "{}: {} of them had not been exported to every collector", path_.string(),
                      unexported);
}

void SqliteStore::setRetention(SqliteRetention retention)
{
    std::lock_guard lock(writer_->mutex());
    newRetention_ = std::move(retention);
}

Dictionary SqliteStore::status()
{
    std::uint64_t bytes = 0;
    for (const char* suffix : {"", "-wal"}) {
        struct stat file {};
        if (::stat((path_.native() + suffix).c_str(), &file) == 0)
            bytes += static_cast<std::uint64_t>(file.st_size);
    }
    std::lock_guard lock(writer_->mutex());
    return Dictionary{{"rows_written", committed_},
                      {"queue_depth", queue_.size()},
                      {"bytes", bytes},
                      {"failures", failures_},
                      {"pending_rows_in_memory", pending_ == nullptr}};
}

// A file removed under the open connection still takes writes, into nothing: the
// store makes a new one instead, and a corrupt one is set aside.
bool SqliteStore::stillOnDisk(std::string& error)
{
    struct stat status {};
    bool present = ::stat(path_.c_str(), &status) == 0 && status.st_dev == connection_.device &&
        status.st_ino == connection_.inode;
    if (present && connection_.database)
        return true;
    if (connection_.database)
        MXLOG_LIMITED(nullptr, Error, "{} was removed: making a new one", path_.string());
    disconnect(connection_);
    logConfigured_ = false;
    measuredBytes_.reset();
    int code = SQLITE_OK;
    if (connect(path_, schema_, statementTexts_, connection_, error, code))
        return true;
    if (isCorruption(code)) {
        auto aside = setAside(path_);
        MXLOG_LIMITED(nullptr, Error, "{} is corrupt ({}): set aside as {}", path_.string(), error,
                      aside.filename().string());
    }
    return false;
}

// Binds the row's parameters and steps its statement: SQLite's result.
int SqliteStore::insert(SqliteWrite& write, std::uint64_t& bytes)
{
    bytes += kRowOverheadBytes;
    sqlite3_stmt* statement = connection_.statements[write.statement];
    if (texts_.size() < write.parameters.size())
        texts_.resize(write.parameters.size());
    for (std::size_t i = 0; i < write.parameters.size(); ++i) {
        int index = static_cast<int>(i) + 1;
        std::visit(
            [&](const auto& value) {
                using T = std::decay_t<decltype(value)>;
                if constexpr (std::is_same_v<T, std::nullptr_t>) {
                    sqlite3_bind_null(statement, index);
                } else if constexpr (std::is_same_v<T, std::int64_t>) {
                    sqlite3_bind_int64(statement, index, value);
                    bytes += sizeof value;
                } else if constexpr (std::is_same_v<T, double>) {
                    sqlite3_bind_double(statement, index, value);
                    bytes += sizeof value;
                } else if constexpr (std::is_same_v<T, std::string>) {
                    sqlite3_bind_text(statement, index, value.data(), static_cast<int>(value.size()), SQLITE_STATIC);
                    bytes += value.size();
                } else {
                    // The text stays in its buffer until the row is stepped.
                    std::string& text = texts_[i];
                    text.clear();
                    if constexpr (std::is_same_v<T, Dictionary>)
                        appendJsonText(text, value);
                    else
                        appendJsonText(text, (*value)());
                    sqlite3_bind_text(statement, index, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
                    bytes += text.size();
                }
            },
            write.parameters[i]);
    }
    int stepped = sqlite3_step(statement);
    sqlite3_reset(statement);
    sqlite3_clear_bindings(statement);
    return stepped;
}

// All or nothing: a batch that fails is rolled back whole and kept, unless what failed
// is a row that SQLite refuses on its own account (a constraint, a type it will not
// take): that row is logged and set aside, and the others go in. Such a row would be
// refused again at every retry and every start, and hold back every row behind it.
bool SqliteStore::commit(std::deque<SqliteWrite>& batch, std::string& error)
{
    sqlite3* database = connection_.database;
    auto failed = [&](const char* what) {
        error = std::string(what) + ": " + sqlite3_errmsg(database);
        int code = sqlite3_extended_errcode(database) & 0xff;
        sqlite3_exec(database, "ROLLBACK", nullptr, nullptr, nullptr);
        if (isCorruption(code)) {
            disconnect(connection_);
            auto aside = setAside(path_);
            MXLOG_LIMITED(nullptr, Error, "{} turned corrupt ({}): set aside as {}, making a new one", path_.string(),
                          error, aside.filename().string());
        }
        return false;
    };
    auto stepOnce = [](sqlite3_stmt* statement) {
        int stepped = sqlite3_step(statement);
        sqlite3_reset(statement);
        return stepped == SQLITE_DONE;
    };
    if (!stepOnce(connection_.begin))
        return failed("begin");
    refused_ = 0;
    std::uint64_t bytes = 0;
    std::uint64_t newestPending = committedPending_;
    // A store with a size bound commits a share of its log's room at a time, so that
    // no transaction takes the log far past its mark.
    std::uint64_t mostBytes = retention_.maxBytes > 0 ? logShare() / 4 : std::numeric_limits<std::uint64_t>::max();
    committedRows_ = 0;
    for (auto& write : batch) {
        if (committedRows_ > 0 && bytes >= mostBytes)
            break;
        ++committedRows_;
        int stepped = insert(write, bytes);
        if (stepped != SQLITE_DONE && !refusesRow(stepped))
            return failed("insert");
        if (stepped != SQLITE_DONE) {
            ++refused_;
            MXLOG_LIMITED(nullptr, Error, "{}: a row it refuses ({}) is set aside: statement {}, {}", path_.string(),
                          sqlite3_errmsg(database), write.statement, describeRow(write));
        }
        newestPending = std::max(newestPending, write.pending);
    }
    // A buffer that grew for one large row (a summary event) is given back.
    for (auto& text : texts_)
        if (text.capacity() > kTextKeptBytes)
            std::string().swap(text);
    if (newestPending != committedPending_) {
        sqlite3_bind_int64(connection_.markCommitted, 1, static_cast<std::int64_t>(newestPending));
        if (!stepOnce(connection_.markCommitted))
            return failed("insert");
    }
    if (!stepOnce(connection_.commit))
        return failed("commit");
    committedPending_ = newestPending;
    unmeasuredBytes_ += bytes;
    return true;
}

std::int64_t SqliteStore::queryInteger(const std::string& sql)
{
    sqlite3* reader = nullptr;
    std::int64_t result = 0;
    if (sqlite3_open_v2(path_.c_str(), &reader, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK)
        result = firstInteger(reader, sql);
    sqlite3_close(reader);
    return result;
}

} // namespace mx
