#pragma once
// Every file-system path of the platform lives under one root: $MXREPORTING_ROOT, or
// "/" when unset. A private root gives a test or a newcomer a complete instance.

#include <filesystem>

namespace mx {

// Where the daemon and its clients meet, under the root.
inline constexpr const char* kServiceSocketPath = "run/harmonia/reporting.sock";
inline constexpr const char* kNotificationSocketPath = "run/harmonia/notify.sock";
inline constexpr const char* kOrientationFeedPath = "run/harmonia/orientation.sock";
inline constexpr const char* kChannelDirectory = "run/harmonia/chanstat";
inline constexpr const char* kPreferencesDirectory = "var/lib/harmonia/preferences";
inline constexpr const char* kDevicePropertiesPath = "etc/harmonia/device.json";

std::filesystem::path MxReportingRoot();
// `relative` under the root ("var/lib/harmonia/tally.db" -> "<root>/var/lib/...").
std::filesystem::path MxReportingPath(const std::filesystem::path& relative);

} // namespace mx
