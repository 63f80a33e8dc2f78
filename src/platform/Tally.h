#pragma once
// Tally: the analytics event service. An event is a name and a payload dictionary;
// the payload is asked for only when the service wants the event.

#include <string_view>

#include "platform/ProcessWide.h"
#include "platform/UniqueFunction.h"
#include "value/Value.h"

namespace mx {

class Tally {
public:
    virtual ~Tally() = default;
    // Callable from any thread; never blocks on storage unless the service's own
    // bounded intake is full. `buildPayload` is called at most once, maybe never.
    virtual void sendEventLazy(std::string_view name, UniqueFunction<Dictionary()> buildPayload) = 0;
};

inline void TallySendEventLazy(std::string_view name, UniqueFunction<Dictionary()> buildPayload)
{
    ProcessWide<Tally>::get().sendEventLazy(name, std::move(buildPayload));
}

} // namespace mx
