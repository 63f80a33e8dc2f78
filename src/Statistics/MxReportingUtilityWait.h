#pragma once
// A bounded wait for a flag that another thread sets under a condition variable,
// with a log line per round. Used by a session's backend queue to wait for backend
// discovery; the waiting thread is declared blocked so its queue's pool lends a
// spare thread to everyone else meanwhile.

#include <condition_variable>
#include <mutex>
#include <string>

#include "platform/MxLog.h"

namespace mx {

struct MxReportingCondition {
    std::mutex mutex;
    std::condition_variable condition;
};

// True once `*flag` is seen true (read under the condition's lock), false when a
// round of `timeoutSeconds` passes without a wake-up. Every wake-up that finds the
// flag still false starts a new full round.
bool MxReportingUtilityWait(MxReportingCondition& condition, const bool* flag, const std::string& message,
                            const std::string& failureMessage, const MxLogScope* scope, double timeoutSeconds);

} // namespace mx
