#pragma once
// mxreport status: what the daemon is doing, as text for a person or as JSON.

#include "tools/MxReportCommand.h"

namespace mx {

std::unique_ptr<MxReportCommand> parseStatusCommand(const Words& words);

} // namespace mx
