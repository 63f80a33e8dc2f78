#pragma once
// Device properties: facts about the build and the hardware the daemon runs on
// ("InternalBuild", "DeviceClassNumber"). Unknown keys read as false / 0.

#include <cstdint>
#include <string_view>

#include "platform/ProcessWide.h"

namespace mx {

class DeviceProperties {
public:
    virtual ~DeviceProperties() = default;
    // Each call asks afresh; callable from any thread.
    virtual bool boolProperty(std::string_view key) = 0;
    virtual std::int64_t integerProperty(std::string_view key) = 0;
};

} // namespace mx
