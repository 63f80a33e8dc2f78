#include "Statistics/MxReportingAggregationArray.h"

#include <algorithm>
#include <cstring>

#include "wire/MsgpackValue.h"

namespace mx {

namespace {

constexpr std::size_t kFirstChunk = 1024;
constexpr std::size_t kLargestChunk = 64 * 1024;

// One encoding buffer per thread, kept between appends.
msgpack::sbuffer& scratch()
{
    thread_local msgpack::sbuffer buffer;
    buffer.clear();
    return buffer;
}

Value decode(const char* bytes, std::size_t size)
{
    auto handle = msgpack::unpack(bytes, size);
    std::string reason;
    // Entries were Values from the wire, at most a level deeper inside a message's
    // identifier: they all decode.
    return decodeMsgpack(handle.get(), reason, kMsgpackMaximumDepth + 1).value_or(Value());
}

} // namespace

MxReportingAggregationArray::Entry MxReportingAggregationArray::store(const char* bytes, std::size_t size)
{
    if (chunks_.empty() || chunks_.back().capacity - chunks_.back().used < size) {
        // Chunks double up to the largest, so a small session holds little and a
        // large one wastes at most part of its last chunk.
        std::size_t capacity = chunks_.empty() ? kFirstChunk : std::min(chunks_.back().capacity * 2, kLargestChunk);
        capacity = std::max(capacity, size);
        chunks_.push_back({std::make_unique<char[]>(capacity), capacity, 0});
    }
    Chunk& chunk = chunks_.back();
    std::memcpy(chunk.bytes.get() + chunk.used, bytes, size);
    Entry entry{static_cast<std::uint32_t>(chunks_.size() - 1), static_cast<std::uint32_t>(chunk.used),
                static_cast<std::uint32_t>(size)};
    chunk.used += size;
    return entry;
}

void MxReportingAggregationArray::append(const Value& value)
{
    auto& buffer = scratch();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    encodeMsgpack(packer, value);
    entries_.push_back(store(buffer.data(), buffer.size()));
}

void MxReportingAggregationArray::insert(std::size_t index, const Value& value)
{
    auto& buffer = scratch();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    encodeMsgpack(packer, value);
    Entry entry = store(buffer.data(), buffer.size());
    entries_.insert(entries_.begin() + static_cast<std::ptrdiff_t>(std::min(index, entries_.size())), entry);
}

void MxReportingAggregationArray::forEach(const std::function<void(const Value&)>& visit) const
{
    for (const auto& entry : entries_)
        visit(decode(chunks_[entry.chunk].bytes.get() + entry.offset, entry.size));
}

std::vector<Value> MxReportingAggregationArray::items() const
{
    std::vector<Value> values;
    values.reserve(entries_.size());
    forEach([&](const Value& value) { values.push_back(value); });
    return values;
}

std::size_t MxReportingAggregationArray::heldBytes() const
{
    std::size_t bytes = entries_.capacity() * sizeof(Entry) + chunks_.capacity() * sizeof(Chunk);
    for (const auto& chunk : chunks_)
        bytes += chunk.capacity;
    return bytes;
}

Array MxReportingAggregationArray::snapshot() const
{
    std::lock_guard lock(monitor_);
    return Array(items());
}

} // namespace mx
