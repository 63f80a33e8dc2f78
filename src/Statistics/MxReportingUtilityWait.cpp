#include "Statistics/MxReportingUtilityWait.h"

#include <chrono>

#include "platform/WorkQueue.h"

namespace mx {

bool MxReportingUtilityWait(MxReportingCondition& condition, const bool* flag, const std::string& message,
                            const std::string& failureMessage, const MxLogScope* scope, double timeoutSeconds)
{
    std::unique_lock lock(condition.mutex);
    if (*flag)
        return true;
    ScopedBlockingCall blocking;
    auto timeout =
        std::chrono::duration_cast<std::chrono::steady_clock::duration>(std::chrono::duration<double>(timeoutSeconds));
    for (;;) {
        MXLOG(scope, Default, "{}", message);
        if (condition.condition.wait_until(lock, std::chrono::steady_clock::now() + timeout) ==
            std::cv_status::timeout) {
            MXLOG(scope, Error, "{}", failureMessage);
            return false;
        }
        MXLOG(scope, Default, "continuing");
        if (*flag)
            return true;
    }
}

} // namespace mx
