#include "platform/linux/StderrLogSink.h"

#include <cstdio>

namespace mx {

void StderrLogSink::write(const MxLogRecord& record)
{
    if (record.level == MxLogLevel::Debug && !MxLogEnabled(record.scope, kMxLogVerboseLevel))
        return;
    // One write per line so that lines of different threads never interleave.
    std::string line = record.message;
    line += '\n';
    std::lock_guard lock(mutex_);
    std::fwrite(line.data(), 1, line.size(), stderr);
    std::fflush(stderr);
}

} // namespace mx
