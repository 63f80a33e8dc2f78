#pragma once
// Where a period's aggregation stores keep their entries: MessagePack bytes back to
// back in chunks that double up to 64 KiB, never moved once written. The two stores
// of a period share one arena, so that a report both keep is kept once.
// Thread-safe: appends and reads take the arena's own lock.

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
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

    Range store(std::string_view bytes);
    // `read` gets the bytes of each range in turn, under the arena's lock.
    void read(const std::vector<Range>& ranges, const std::function<void(std::string_view)>& read) const;

private:
    struct Chunk {
        std::unique_ptr<char[]> bytes;
        std::size_t capacity = 0;
        std::size_t used = 0;
    };

    mutable std::mutex mutex_;
    std::vector<Chunk> chunks_;
};

} // namespace mx
