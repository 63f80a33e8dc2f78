#pragma once
// The log sink of a daemon run by hand: one line per message on stderr. Debug lines
// appear only for scopes whose verbose switch is on.

#include <mutex>

#include "platform/MxLog.h"

namespace mx {

class StderrLogSink final : public MxLogSink {
public:
    void write(const MxLogRecord& record) override;

private:
    std::mutex mutex_;
};

} // namespace mx
