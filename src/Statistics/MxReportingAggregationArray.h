#pragma once
// One of a session's aggregation stores: the messages of the current reporting
// period, appended on the server queue and by orientation callbacks, read at stop.
// The array carries its own recursive monitor; whoever reads or writes it, or drops
// it from the session, holds that monitor.

#include <mutex>
#include <vector>

#include "platform/Value.h"

namespace mx {

class MxReportingAggregationArray {
public:
    std::recursive_mutex& monitor() const { return monitor_; }

    // Callers hold monitor().
    void append(Value value) { items_.push_back(std::move(value)); }
    void insert(std::size_t index, Value value)
    {
        items_.insert(items_.begin() + std::ptrdiff_t(index), std::move(value));
    }
    const std::vector<Value>& items() const { return items_; }

    // A copy taken under the monitor.
    Array snapshot() const
    {
        std::lock_guard lock(monitor_);
        return Array(items_);
    }

private:
    mutable std::recursive_mutex monitor_;
    std::vector<Value> items_;
};

} // namespace mx
