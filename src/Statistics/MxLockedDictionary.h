#pragma once
// A dictionary that one queue merges into while others read it: a session's user
// information, filled on the server queue and read by the backend queue and the
// sinks. Readers take a snapshot, which costs one reference count.

#include <mutex>
#include <optional>
#include <string_view>

#include "value/Value.h"

namespace mx {

class MxLockedDictionary {
public:
    Dictionary snapshot() const
    {
        std::lock_guard lock(mutex_);
        return dictionary_;
    }

    std::optional<Value> find(std::string_view key) const
    {
        std::lock_guard lock(mutex_);
        const Value* value = dictionary_.find(key);
        return value ? std::optional<Value>(*value) : std::nullopt;
    }

    void merge(const Dictionary& entries)
    {
        std::lock_guard lock(mutex_);
        dictionary_.merge(entries);
    }

private:
    mutable std::mutex mutex_;
    Dictionary dictionary_;
};

} // namespace mx
