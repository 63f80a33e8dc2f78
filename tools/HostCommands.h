#pragma once
// mxreport's commands that talk to the host rather than the daemon's socket: the
// preferences domain (defaults), the notification (notify), the orientation feed
// (orientation) and the driver channel files (channels).

#include "tools/MxReportCommand.h"

namespace mx {

std::unique_ptr<MxReportCommand> parseHostCommand(const Words& words);

} // namespace mx
