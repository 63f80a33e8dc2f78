#pragma once
// Everything the daemon reads from etc/harmonia/: the device properties (checked
// here, read on every query), the wanted analytics events, the backends and the
// store limits. Read strictly at start-up, by --check-config, and again on SIGHUP,
// when a configuration that fails the check is refused and the one in use kept.

#include <optional>
#include <string>
#include <vector>

#include "platform/linux/SpoolUplink.h"
#include "platform/linux/StoreLimits.h"

namespace mx {

struct DaemonConfiguration {
    StoreLimits limits;
    std::vector<std::string> disabledEvents;
    SpoolUplink::Backends backends;

    // The configuration under the root, or nothing with every error found, each
    // "file:line:column: what is wrong".
    static std::optional<DaemonConfiguration> read(std::vector<std::string>& errors);
};

} // namespace mx
