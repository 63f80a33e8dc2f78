#pragma once
// Preferences: named domains of user-settable values.

#include <string>

#include "value/Value.h"

namespace mx {

class Preferences {
public:
    virtual ~Preferences() = default;
    // The domain's values as stored now (empty when the domain has none or cannot be
    // read). Callable from any thread.
    virtual Dictionary copyDomain(const std::string& domain) = 0;
};

} // namespace mx
