#pragma once
// mxreport's protocol operations: create, type, service-type, configure, start, send,
// stop, destroy, valid, reporters, kill. Each talks to the daemon over the chain's
// connection and prints what it answered.

#include "tools/MxReportCommand.h"

namespace mx {

std::unique_ptr<MxReportCommand> parseProtocolCommand(const Words& words);

} // namespace mx
