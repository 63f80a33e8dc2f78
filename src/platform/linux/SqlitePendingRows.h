#pragma once
// The rows a store was handed and has not committed yet, kept in a file beside it
// ("tally.db-pending") that is mapped into memory: keeping a row is a copy into the
// page cache, no system call, and the kernel keeps the pages when the process dies.
// A store whose rows are kept here can let them gather for a long window, and a
// SIGKILL still loses none of them: the next start writes them in.
//
// The file is a ring of records after a short header. A record is its magic, length,
// number and checksum, then the row as MessagePack; the word after the newest record
// is always zero, and a record's magic is written last, so a record cut short by the
// process dying is never read back. The header names the oldest record still wanted;
// reading starts there and follows the records, numbered one after another, until a
// word that is not a record's magic. Records whose rows the store committed are given
// back, and once none is wanted the next starts again at the front, so that a store at
// everyday rates writes over the same few pages.
// Not thread-safe: the store calls it under its writer's lock, except where noted.

#include <atomic>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/SqliteWrite.h"

namespace mx {

class SqlitePendingRows {
public:
    // Room for a second or so of a store's rows at a few hundred reports a second; a
    // store whose rows outrun it commits the rest within its short window instead.
    static constexpr std::size_t kFileBytes = std::size_t{256} << 10;

    // Opens the file of `storeName`'s pending rows ("tally.db"), or makes it when it is
    // missing or is not such a file. One that is not the daemon's own (not a regular
    // file, more than one link, another owner, a mode others may write) is set aside
    // unread, with a line in the log. Nothing, with `error`, when it cannot be made or
    // mapped.
    static std::unique_ptr<SqlitePendingRows> open(const std::filesystem::path& path, const std::string& storeName,
                                                   std::string& error);
    ~SqlitePendingRows();
    SqlitePendingRows(const SqlitePendingRows&) = delete;
    SqlitePendingRows& operator=(const SqlitePendingRows&) = delete;

    // At start-up, before anything is kept: the rows numbered after `committed`, in
    // order, each with its number in `pending`. They stay kept until released, and
    // rows kept from now on are numbered after them. A row that cannot be read back
    // (its statement is not one of `statements`) is logged and left out; a damaged
    // record ends the reading, and the log says how many records lay past it.
    std::vector<SqliteWrite> rowsAfter(std::uint64_t committed, std::size_t statements);

    // Any thread: the row as it is kept, in a buffer of the calling thread valid until
    // its next call, or nothing for a row larger than the file. A deferred dictionary in
    // it is built first, in place.
    static std::string_view encode(SqliteWrite& write);
    // Keeps an encoded row: its number, or 0 when there is no room for it.
    std::uint64_t keep(std::string_view encoded);
    // Rows numbered up to `number` are committed: their room may be taken again.
    void release(std::uint64_t number);
    // Any thread, without the lock: whether an everyday row may fit, before it is encoded.
    bool mayHaveRoom() const { return room_.load(std::memory_order_relaxed) >= kEverydayRowBytes; }
    // Any thread, without the lock: over half the file is taken, and its rows should be
    // committed soon, before a row finds no room (its reply would wait for a commit).
    bool halfTaken() const { return room_.load(std::memory_order_relaxed) < kFileBytes / 2; }
    // Any thread, without the lock: less than a quarter of the file is left.
    bool mostlyTaken() const { return room_.load(std::memory_order_relaxed) < kFileBytes / 4; }

    const std::filesystem::path& path() const { return path_; }

private:
    static constexpr std::size_t kEverydayRowBytes = 1024;

    SqlitePendingRows(std::filesystem::path path, char* base);
    std::uint64_t tail() const { return kept_.empty() ? head_ : kept_.front().offset; }
    std::size_t recordsNewerThan(std::uint64_t number) const;
    void publishTail();
    std::optional<std::uint64_t> placeFor(std::size_t bytes, bool& wraps);
    void updateRoom();

    struct Kept {
        std::uint64_t number;
        std::uint64_t offset;
    };

    const std::filesystem::path path_;
    char* const base_; // the mapping, kFileBytes long
    std::uint64_t head_;
    std::uint64_t next_ = 1;
    std::deque<Kept> kept_; // oldest first
    std::atomic<std::size_t> room_{0};
};

} // namespace mx
