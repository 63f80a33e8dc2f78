#include "Statistics/MxReportingEncodedArena.h"

#include <algorithm>
#include <cstring>
#include <stdexcept>

#include <zstd.h>

namespace mx {

namespace {

constexpr std::size_t kFirstChunk = 1024;
constexpr std::size_t kLargestChunk = std::size_t{64} * 1024;
constexpr int kCompressionLevel = 1;

std::atomic<std::size_t> gKeptInAll{0};

} // namespace

MxReportingEncodedArena::~MxReportingEncodedArena() { gKeptInAll.fetch_sub(keptBytes(), std::memory_order_relaxed); }

std::size_t MxReportingEncodedArena::keptInAll() { return gKeptInAll.load(std::memory_order_relaxed); }

// The context is reused for every chunk a thread seals: making one costs more than
// compressing a chunk.
void MxReportingEncodedArena::seal(Chunk& chunk)
{
    thread_local std::unique_ptr<ZSTD_CCtx, decltype(&ZSTD_freeCCtx)> context{ZSTD_createCCtx(), &ZSTD_freeCCtx};
    if (!context || chunk.used == 0)
        return;
    auto compressed = std::make_unique_for_overwrite<char[]>(ZSTD_compressBound(chunk.used));
    std::size_t size = ZSTD_compressCCtx(context.get(), compressed.get(), ZSTD_compressBound(chunk.used),
                                         chunk.bytes.get(), chunk.used, kCompressionLevel);
    // Bytes that do not compress stay as they are.
    if (ZSTD_isError(size) || size >= chunk.used)
        return;
    chunk.bytes = std::make_unique_for_overwrite<char[]>(size);
    std::memcpy(chunk.bytes.get(), compressed.get(), size);
    chunk.capacity = size;
    chunk.compressedSize = size;
}

const char* MxReportingEncodedArena::bytesOf(std::uint32_t index) const
{
    const Chunk& chunk = chunks_[index];
    if (chunk.compressedSize == 0)
        return chunk.bytes.get();
    if (expandedIndex_ != index) {
        expanded_.resize(chunk.used);
        std::size_t size = ZSTD_decompress(expanded_.data(), chunk.used, chunk.bytes.get(), chunk.compressedSize);
        // Only memory the arena wrote itself is read: a failure is a fault of this code.
        if (ZSTD_isError(size) || size != chunk.used)
            throw std::logic_error("a sealed chunk of reports does not expand");
        expandedIndex_ = index;
    }
    return expanded_.data();
}

MxReportingEncodedArena::Range MxReportingEncodedArena::store(std::string_view bytes)
{
    std::lock_guard lock(mutex_);
    if (chunks_.empty() || chunks_.back().capacity - chunks_.back().used < bytes.size()) {
        // A small period holds little, and a large one wastes at most part of a chunk.
        std::size_t capacity = chunks_.empty() ? kFirstChunk : std::min(chunks_.back().used * 2, kLargestChunk);
        capacity = std::max(capacity, bytes.size());
        if (!chunks_.empty())
            seal(chunks_.back());
        chunks_.push_back({std::make_unique_for_overwrite<char[]>(capacity), capacity, 0, 0});
    }
    Chunk& chunk = chunks_.back();
    std::memcpy(chunk.bytes.get() + chunk.used, bytes.data(), bytes.size());
    Range range{static_cast<std::uint32_t>(chunks_.size() - 1), static_cast<std::uint32_t>(chunk.used),
                static_cast<std::uint32_t>(bytes.size())};
    chunk.used += bytes.size();
    kept_.fetch_add(bytes.size(), std::memory_order_relaxed);
    gKeptInAll.fetch_add(bytes.size(), std::memory_order_relaxed);
    return range;
}

void MxReportingEncodedArena::read(const std::vector<Range>& ranges,
                                   const std::function<void(std::string_view)>& read) const
{
    std::lock_guard lock(mutex_);
    for (const auto& range : ranges)
        read(range.size == 0 ? std::string_view() : std::string_view(bytesOf(range.chunk) + range.offset, range.size));
}

} // namespace mx
