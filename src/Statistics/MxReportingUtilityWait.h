#pragma once
// A bounded wait for a flag that another thread sets under a condition variable,
// with a log line per round. The blocking form holds its thread (declared blocked, so
// its queue's pool lends a spare thread meanwhile). The queue form holds no thread at
// all: a session's backend queue waits for backend discovery in it, so that sixteen
// thousand sessions waiting at once cost timers, not threads. Both write the same
// lines, under the same function name.

#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>

#include "platform/MxLog.h"
#include "platform/UniqueFunction.h"
#include "platform/WorkQueue.h"

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

// The flag and condition of the queue form: set by another thread, which wakes the
// wait on its queue.
class MxReportingQueueCondition {
public:
    explicit MxReportingQueueCondition(bool flag) : flag_(flag) {}
    // Sets the flag and wakes the wait, if one is on. Any thread.
    void signal();

private:
    friend class MxReportingQueueWait;
    std::mutex mutex_;
    bool flag_;
    UniqueFunction<void()> wake_; // while a wait is on
};

// The same wait for work of a serial queue that holds the queue, not a thread: the
// work returns at once and `done` gets the outcome on `queue` later, or in place at
// once when the flag is already set (no line then, as in the blocking form).
void MxReportingUtilityWait(const std::shared_ptr<MxReportingQueueCondition>& condition, const std::string& message,
                            const std::string& failureMessage, const MxLogScope* scope, double timeoutSeconds,
                            const std::shared_ptr<WorkQueue>& queue, UniqueFunction<void(bool)> done);

} // namespace mx
