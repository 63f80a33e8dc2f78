#pragma once
// Every file-system path of the platform lives under one root: $MXREPORTING_ROOT, or
// "/" when unset. A private root gives a test or a newcomer a complete instance.

#include <filesystem>

namespace mx {

std::filesystem::path MxReportingRoot();
// `relative` under the root ("var/lib/harmonia/tally.db" -> "<root>/var/lib/...").
std::filesystem::path MxReportingPath(const std::filesystem::path& relative);

} // namespace mx
