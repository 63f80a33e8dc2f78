#pragma once
// A field whose every read and write is indivisible: the accessor pairs of objects
// that several queues touch (a session's backend session, its parked reply). Reads
// return a copy, so a reader never sees a value being replaced under it.

#include <mutex>
#include <utility>

namespace mx {

template <class T>
class MxAtomicProperty {
public:
    MxAtomicProperty() = default;
    explicit MxAtomicProperty(T value) : value_(std::move(value)) {}

    T get() const
    {
        std::lock_guard lock(mutex_);
        return value_;
    }

    // The old value is released after the lock: its destructor may run user code.
    void set(T value) { (void)exchange(std::move(value)); }

    // Replaces the value and hands back the one it held.
    T exchange(T value)
    {
        std::lock_guard lock(mutex_);
        std::swap(value_, value);
        return value;
    }

private:
    mutable std::mutex mutex_;
    T value_{};
};

} // namespace mx
