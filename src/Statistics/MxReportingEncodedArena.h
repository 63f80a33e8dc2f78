#pragma once
// Where a period's aggregation stores keep their entries: MessagePack bytes back to
// back in chunks that double up to 64 KiB, never moved once written. The two stores
// of a period share one arena, so that a report both keep is kept once. A chunk that
// is full is compressed (zstd, its fastest level): a period keeps every report until
// its summary, and reports of one component repeat their keys and much of their
// values, so a busy period holds a fraction of what it was sent. Reading undoes it.
// What an arena keeps is counted as written, before compression, since that is what
// reading it back at a summary costs; and so is what every arena of the process keeps.
// Thread-safe: appends and reads take the arena's own lock.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string_view>
#include <vector>

namespace mx {

class MxReportingEncodedArena {
public:
    struct Range {
        std::uint32_t chunk = 0;
        std::uint32_t offset = 0;
        std::uint32_t size = 0;
    };

    MxReportingEncodedArena() = default;
    ~MxReportingEncodedArena();
    MxReportingEncodedArena(const MxReportingEncodedArena&) = delete;
    MxReportingEncodedArena& operator=(const MxReportingEncodedArena&) = delete;

    Range store(std::string_view bytes);
    // `read` gets the bytes of each range in turn, under the arena's lock.
    void read(const std::vector<Range>& ranges, const std::function<void(std::string_view)>& read) const;

    // Bytes stored in this arena, and in every arena alive in the process.
    std::size_t keptBytes() const { return kept_.load(std::memory_order_relaxed); }
    static std::size_t keptInAll();

private:
    struct Chunk {
        std::unique_ptr<char[]> bytes; // as written, or compressed once sealed
        std::size_t capacity = 0;
        std::size_t used = 0;
        std::size_t compressedSize = 0; // 0: not compressed
    };

    static void seal(Chunk& chunk);
    // The bytes of chunk `index` as written: in place, or expanded into `expanded_`.
    const char* bytesOf(std::uint32_t index) const;

    mutable std::mutex mutex_;
    std::atomic<std::size_t> kept_{0};
    std::vector<Chunk> chunks_;
    // The last compressed chunk a read expanded, kept for the reads after it: entries
    // are read one by one, in the order they were written.
    mutable std::vector<char> expanded_;
    mutable std::optional<std::uint32_t> expandedIndex_;
};

} // namespace mx
