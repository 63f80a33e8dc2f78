#include "daemon/DaemonConfiguration.h"

#include "platform/linux/JsonDeviceProperties.h"
#include "platform/linux/SqliteTally.h"
#include "wire/RootPath.h"

namespace mx {

std::optional<DaemonConfiguration> DaemonConfiguration::read(std::vector<std::string>& errors)
{
    // Every file is read, so that one check shows every error at once.
    bool device = JsonDeviceProperties::check(MxReportingPath("etc/harmonia/device.json"), errors);
    auto limits = StoreLimits::read(MxReportingPath("etc/harmonia/stores.json"), errors);
    auto disabled = SqliteTally::readDisabled(MxReportingPath("etc/harmonia/tally.json"), errors);
    auto backends = SpoolUplink::readBackends(MxReportingPath("etc/harmonia/uplink.json"), errors);
    if (!device || !limits || !disabled || !backends || !errors.empty())
        return std::nullopt;
    return DaemonConfiguration{*limits, std::move(*disabled), std::move(*backends)};
}

} // namespace mx
