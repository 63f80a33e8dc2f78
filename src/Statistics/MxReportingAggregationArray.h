#pragma once
// One of a session's aggregation stores: the messages of the current reporting
// period, appended on the server queue and by orientation callbacks, read at stop.
// The array carries its own recursive monitor; whoever reads or writes it, or drops
// it from the session, holds that monitor.
//
// A busy session keeps every report of its period, and nothing reads them before the
// stop: they are kept encoded (MessagePack, back to back in chunks that grow to
// 64 KiB), about their size on the wire, and decoded only when read.

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/Value.h"

namespace mx {

class MxReportingAggregationArray {
public:
    std::recursive_mutex& monitor() const { return monitor_; }

    // Callers hold monitor().
    void append(const Value& value);
    void insert(std::size_t index, const Value& value);
    std::size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    // Each entry decoded in turn, in order: one at a time, however many there are.
    void forEach(const std::function<void(const Value&)>& visit) const;
    // The entries decoded, in order.
    std::vector<Value> items() const;
    // The bytes the array holds for its entries, spare room included.
    std::size_t heldBytes() const;

    // A copy taken under the monitor.
    Array snapshot() const;

private:
    struct Entry {
        std::uint32_t chunk;
        std::uint32_t offset;
        std::uint32_t size;
    };
    struct Chunk {
        std::unique_ptr<char[]> bytes;
        std::size_t capacity = 0;
        std::size_t used = 0;
    };

    Entry store(const char* bytes, std::size_t size);

    mutable std::recursive_mutex monitor_;
    std::vector<Chunk> chunks_;
    std::vector<Entry> entries_;
};

} // namespace mx
