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

void appendNumber(std::uint32_t number, std::uint8_t*& out)
{
    for (; number >= 0x80; number >>= 7)
        *out++ = static_cast<std::uint8_t>(number | 0x80);
    *out++ = static_cast<std::uint8_t>(number);
}

std::uint32_t readNumber(const std::deque<std::uint8_t>& bytes, std::size_t& position)
{
    std::uint32_t number = 0;
    for (int shift = 0;; shift += 7) {
        std::uint8_t byte = bytes[position++];
        number |= std::uint32_t(byte & 0x7f) << shift;
        if ((byte & 0x80) == 0)
            return number;
    }
}

} // namespace

// The body's chunk carries, in its lowest bit, whether a lead comes first.
std::size_t MxReportingAggregationArray::encode(const Entry& entry, EncodedBytes& bytes)
{
    std::uint8_t* out = bytes.data();
    bool led = entry.lead.size != 0;
    appendNumber(entry.body.chunk << 1 | std::uint32_t(led), out);
    appendNumber(entry.body.offset, out);
    appendNumber(entry.body.size, out);
    if (led) {
        appendNumber(entry.lead.chunk, out);
        appendNumber(entry.lead.offset, out);
        appendNumber(entry.lead.size, out);
    }
    return static_cast<std::size_t>(out - bytes.data());
}

MxReportingAggregationArray::Entry MxReportingAggregationArray::decode(std::size_t& position) const
{
    Entry entry;
    std::uint32_t chunk = readNumber(entries_, position);
    entry.body = {chunk >> 1, readNumber(entries_, position), readNumber(entries_, position)};
    if ((chunk & 1) != 0)
        entry.lead = {readNumber(entries_, position), readNumber(entries_, position), readNumber(entries_, position)};
    return entry;
}

void MxReportingAggregationArray::add(std::size_t index, const Entry& entry)
{
    EncodedBytes bytes;
    std::size_t length = encode(entry, bytes);
    std::size_t position = entries_.size();
    if (index < count_) {
        position = 0;
        for (std::size_t skipped = 0; skipped < index; ++skipped)
            decode(position);
    }
    entries_.insert(entries_.begin() + static_cast<std::ptrdiff_t>(position), bytes.begin(),
                    bytes.begin() + static_cast<std::ptrdiff_t>(length));
    ++count_;
}

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
    add(index, {{}, store(*arena_, value)});
}

void MxReportingAggregationArray::appendStored(Range stored) { add(count_, {{}, stored}); }

void MxReportingAggregationArray::appendStoredUnder(const std::string& key, Range stored)
{
    auto& buffer = scratch();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    packer.pack_map(1);
    packer.pack(key);
    add(count_, {storeScratch(*arena_, buffer), stored});
}

void MxReportingAggregationArray::forEachEncoded(const std::function<void(std::string_view)>& visit) const
{
    std::string bytes;
    for (std::size_t position = 0; position < entries_.size();) {
        Entry entry = decode(position);
        bytes.clear();
        arena_->read({entry.lead, entry.body}, [&](std::string_view part) { bytes += part; });
        visit(bytes);
    }
}

void MxReportingAggregationArray::forEach(const std::function<void(const Value&)>& visit) const
{
    forEachEncoded([&](std::string_view bytes) {
        auto handle = msgpack::unpack(bytes.data(), bytes.size());
        std::string reason;
        // Entries were Values from the wire, at most a level deeper under a message's
        // identifier: they all decode.
        visit(decodeMsgpack(handle.get(), reason, kMsgpackMaximumDepth + 1).value_or(Value()));
    });
}

std::vector<Value> MxReportingAggregationArray::items() const
{
    std::vector<Value> values;
    values.reserve(count_);
    forEach([&](const Value& value) { values.push_back(value); });
    return values;
}

Array MxReportingAggregationArray::snapshot() const
{
    std::lock_guard lock(monitor_);
    return Array(items());
}

} // namespace mx
