#pragma once
// mxreport demo: a realistic long-form audio session played step by step, with what
// each step answers, the drivers' growth its stop reports and, on an internal build,
// the summary event its stop wrote.

#include "tools/MxReportCommand.h"

namespace mx {

std::unique_ptr<MxReportCommand> parseDemoCommand(const Words& words);

} // namespace mx
