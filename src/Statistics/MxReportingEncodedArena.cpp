#include "Statistics/MxReportingEncodedArena.h"

#include <algorithm>
#include <cstring>

namespace mx {

namespace {

constexpr std::size_t kFirstChunk = 1024;
constexpr std::size_t kLargestChunk = std::size_t{64} * 1024;

} // namespace

MxReportingEncodedArena::Range MxReportingEncodedArena::store(std::string_view bytes)
{
    std::lock_guard lock(mutex_);
    if (chunks_.empty() || chunks_.back().capacity - chunks_.back().used < bytes.size()) {
        // A small period holds little, and a large one wastes at most part of a chunk.
        std::size_t capacity = chunks_.empty() ? kFirstChunk : std::min(chunks_.back().capacity * 2, kLargestChunk);
        capacity = std::max(capacity, bytes.size());
        chunks_.push_back({std::make_unique<char[]>(capacity), capacity, 0});
    }
    Chunk& chunk = chunks_.back();
    std::memcpy(chunk.bytes.get() + chunk.used, bytes.data(), bytes.size());
    Range range{static_cast<std::uint32_t>(chunks_.size() - 1), static_cast<std::uint32_t>(chunk.used),
                static_cast<std::uint32_t>(bytes.size())};
    chunk.used += bytes.size();
    return range;
}

void MxReportingEncodedArena::read(const std::vector<Range>& ranges,
                                   const std::function<void(std::string_view)>& read) const
{
    std::lock_guard lock(mutex_);
    for (const auto& range : ranges)
        read(std::string_view(chunks_[range.chunk].bytes.get() + range.offset, range.size));
}

} // namespace mx
