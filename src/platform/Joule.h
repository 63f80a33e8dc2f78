#pragma once
// Joule: the power and energy log. Events are filed under a registered agent number.

#include <cstdint>
#include <string_view>

#include "platform/ProcessWide.h"
#include "value/Value.h"

namespace mx {

class Joule {
public:
    virtual ~Joule() = default;
    // Callable from any thread; `options` is reserved and passed as nothing.
    virtual void logRegisteredEvent(std::int32_t agent, std::string_view name, Dictionary event,
                                    const Dictionary* options) = 0;
};

inline void JouleLogRegisteredEvent(std::int32_t agent, std::string_view name, Dictionary event,
                                    const Dictionary* options)
{
    ProcessWide<Joule>::get().logRegisteredEvent(agent, name, std::move(event), options);
}

} // namespace mx
