#pragma once
// mxreport's block throttle commands: throttle-key (a message's key and throttle
// time) and stream (JSON lines from stdin, each sent, through one throttle with
// --throttle).

#include "tools/MxReportCommand.h"

namespace mx {

std::unique_ptr<MxReportCommand> parseStreamCommand(const Words& words);

} // namespace mx
