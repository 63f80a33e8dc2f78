#pragma once
// One of a session's aggregation stores: the messages of the current reporting
// period, appended on the server queue and by orientation callbacks, read at stop.
// The array carries its own recursive monitor; whoever reads or writes it, or drops
// it from the session, holds that monitor.
//
// A busy session keeps every report of its period, and nothing reads them before the
// stop: entries are kept encoded in the period's arena, about their size on the
// wire, and decoded only when read. The period's two stores share one arena, so a
// report that both keep (the nested one under its identifier) is kept once.

#include <array>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/MxReportingEncodedArena.h"
#include "value/Value.h"

namespace mx {

class MxReportingAggregationArray {
public:
    using Range = MxReportingEncodedArena::Range;

    explicit MxReportingAggregationArray(
        std::shared_ptr<MxReportingEncodedArena> arena = std::make_shared<MxReportingEncodedArena>());

    std::recursive_mutex& monitor() const { return monitor_; }
    const std::shared_ptr<MxReportingEncodedArena>& arena() const { return arena_; }

    // `value` encoded into `arena`, for appendStored and appendStoredUnder.
    static Range store(MxReportingEncodedArena& arena, const Value& value);

    // Callers hold monitor().
    void append(const Value& value);
    void insert(std::size_t index, const Value& value);
    // An entry already in this array's arena, as it is or as {key: entry}.
    void appendStored(Range stored);
    void appendStoredUnder(const std::string& key, Range stored);
    std::size_t size() const { return count_; }
    bool empty() const { return count_ == 0; }
    // Each entry decoded in turn, in order: one at a time, however many there are.
    void forEach(const std::function<void(const Value&)>& visit) const;
    // Each entry's MessagePack bytes in turn, in order.
    void forEachEncoded(const std::function<void(std::string_view)>& visit) const;
    // The entries decoded, in order.
    std::vector<Value> items() const;

    // A copy taken under the monitor.
    Array snapshot() const;

private:
    // The bytes of `lead` (when it has any) then those of `body` make the entry.
    struct Entry {
        Range lead;
        Range body;
    };

    // Six numbers of at most five bytes each.
    using EncodedBytes = std::array<std::uint8_t, 30>;
    static std::size_t encode(const Entry& entry, EncodedBytes& bytes);
    // The entry whose bytes begin at `position`, which moves past them.
    Entry decode(std::size_t& position) const;
    void add(std::size_t index, const Entry& entry);

    mutable std::recursive_mutex monitor_;
    const std::shared_ptr<MxReportingEncodedArena> arena_;
    // The entries' ranges as variable-length integers, back to back: a few bytes an
    // entry rather than 24, and a busy period keeps hundreds of thousands of them.
    std::deque<std::uint8_t> entries_;
    std::size_t count_ = 0;
};

} // namespace mx
