#include "Statistics/MxReportingAggregationArray.h"

#include <algorithm>

#include "wire/MsgpackValue.h"

namespace mx {

namespace {

// One encoding buffer per thread, kept between appends.
msgpack::sbuffer& scratch()
{
    thread_local msgpack::sbuffer buffer;
    buffer.clear();
    return buffer;
}

// A buffer that grew for one large value (a summary event holds a whole period) is
// given back, not kept for the thread's life.
constexpr std::size_t kScratchKeptBytes = std::size_t{64} << 10;

MxReportingEncodedArena::Range storeScratch(MxReportingEncodedArena& arena, msgpack::sbuffer& buffer)
{
    auto stored = arena.store(std::string_view(buffer.data(), buffer.size()));
    if (buffer.size() > kScratchKeptBytes)
        buffer = msgpack::sbuffer();
    return stored;
}

} // namespace

MxReportingAggregationArray::MxReportingAggregationArray(std::shared_ptr<MxReportingEncodedArena> arena)
    : arena_(std::move(arena))
{
}

MxReportingAggregationArray::Range MxReportingAggregationArray::store(MxReportingEncodedArena& arena,
                                                                      const Value& value)
{
    auto& buffer = scratch();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    encodeMsgpack(packer, value);
    return storeScratch(arena, buffer);
}

void MxReportingAggregationArray::append(const Value& value) { appendStored(store(*arena_, value)); }

void MxReportingAggregationArray::insert(std::size_t index, const Value& value)
{
    Entry entry{{}, store(*arena_, value)};
    entries_.insert(entries_.begin() + static_cast<std::ptrdiff_t>(std::min(index, entries_.size())), entry);
}

void MxReportingAggregationArray::appendStored(Range stored) { entries_.push_back({{}, stored}); }

void MxReportingAggregationArray::appendStoredUnder(const std::string& key, Range stored)
{
    auto& buffer = scratch();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    packer.pack_map(1);
    packer.pack(key);
    entries_.push_back({storeScratch(*arena_, buffer), stored});
}

void MxReportingAggregationArray::forEach(const std::function<void(const Value&)>& visit) const
{
    std::string bytes;
    for (const auto& entry : entries_) {
        bytes.clear();
        arena_->read({entry.lead, entry.body}, [&](std::string_view part) { bytes += part; });
        auto handle = msgpack::unpack(bytes.data(), bytes.size());
        std::string reason;
        // Entries were Values from the wire, at most a level deeper under a message's
        // identifier: they all decode.
        visit(decodeMsgpack(handle.get(), reason, kMsgpackMaximumDepth + 1).value_or(Value()));
    }
}

std::vector<Value> MxReportingAggregationArray::items() const
{
    std::vector<Value> values;
    values.reserve(entries_.size());
    forEach([&](const Value& value) { values.push_back(value); });
    return values;
}

Array MxReportingAggregationArray::snapshot() const
{
    std::lock_guard lock(monitor_);
    return Array(items());
}

} // namespace mx
