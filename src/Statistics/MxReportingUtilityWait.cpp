#include "Statistics/MxReportingUtilityWait.h"

#include <chrono>

namespace mx {

namespace {

std::chrono::steady_clock::duration toDuration(double seconds)
{
    return std::chrono::duration_cast<std::chrono::steady_clock::duration>(std::chrono::duration<double>(seconds));
}

} // namespace

bool MxReportingUtilityWait(MxReportingCondition& condition, const bool* flag, const std::string& message,
                            const std::string& failureMessage, const MxLogScope* scope, double timeoutSeconds)
{
    std::unique_lock lock(condition.mutex);
    if (*flag)
        return true;
    ScopedBlockingCall blocking;
    auto timeout = toDuration(timeoutSeconds);
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

void MxReportingQueueCondition::signal()
{
    UniqueFunction<void()> wake;
    {
        std::lock_guard lock(mutex_);
        flag_ = true;
        wake = std::move(wake_);
    }
    if (wake)
        wake();
}

// One wait of the queue form, held by its pending timeout and wake-up; the condition
// knows it only weakly, so a wait whose queue is dropped with its work leaves nothing.
class MxReportingQueueWait : public std::enable_shared_from_this<MxReportingQueueWait> {
public:
    MxReportingQueueWait(std::shared_ptr<MxReportingQueueCondition> condition, std::string message,
                         std::string failureMessage, const MxLogScope* scope, double timeoutSeconds,
                         std::shared_ptr<WorkQueue> queue, UniqueFunction<void(bool)> done)
        : condition_(std::move(condition)),
          message_(std::move(message)),
          failureMessage_(std::move(failureMessage)),
          scope_(scope),
          timeout_(toDuration(timeoutSeconds)),
          queue_(std::move(queue)),
          done_(std::move(done))
    {
    }

    static void wait(const std::shared_ptr<MxReportingQueueCondition>& condition, const std::string& message,
                     const std::string& failureMessage, const MxLogScope* scope, double timeoutSeconds,
                     const std::shared_ptr<WorkQueue>& queue, UniqueFunction<void(bool)> done)
    {
        std::unique_lock lock(condition->mutex_);
        if (condition->flag_) {
            lock.unlock();
            done(true);
            return;
        }
        auto wait = std::make_shared<MxReportingQueueWait>(condition, message, failureMessage, scope, timeoutSeconds,
                                                           queue, std::move(done));
        wait->beginRound();
    }

private:
    // Under the condition's lock: a round, with its line and its timeout, as the
    // blocking form's loop writes them.
    void beginRound()
    {
        std::uint64_t round = ++round_;
        condition_->wake_ = [weakSelf = weak_from_this()] {
            if (auto self = weakSelf.lock())
                self->queue_->dispatch([self] { self->wake(); });
        };
        MxLogWrite(scope_, MxLogLevel::Default, kFile, __LINE__, kSignature, message_);
        queue_->dispatchTimeout(timeout_, [self = shared_from_this(), round] { self->expire(round); });
    }

    // The blocking form's lines are this wait's: the same file and function.
    static constexpr const char* kFile = "MxReportingUtilityWait.cpp";
    static constexpr const char* kSignature = "bool mx::MxReportingUtilityWait()";

    void wake()
    {
        std::unique_lock lock(condition_->mutex_);
        if (over_)
            return;
        MxLogWrite(scope_, MxLogLevel::Default, kFile, __LINE__, kSignature, "continuing");
        if (!condition_->flag_) {
            beginRound();
            return;
        }
        finish(lock, true);
    }

    void expire(std::uint64_t round)
    {
        std::unique_lock lock(condition_->mutex_);
        if (over_ || round != round_)
            return;
        MxLogWrite(scope_, MxLogLevel::Error, kFile, __LINE__, kSignature, failureMessage_);
        finish(lock, false);
    }

    void finish(std::unique_lock<std::mutex>& lock, bool found)
    {
        over_ = true;
        condition_->wake_ = nullptr;
        auto done = std::move(done_);
        lock.unlock();
        done(found);
    }

    const std::shared_ptr<MxReportingQueueCondition> condition_;
    const std::string message_;
    const std::string failureMessage_;
    const MxLogScope* const scope_;
    const std::chrono::steady_clock::duration timeout_;
    const std::shared_ptr<WorkQueue> queue_;
    UniqueFunction<void(bool)> done_;
    // Under the condition's lock.
    std::uint64_t round_ = 0;
    bool over_ = false;
};

void MxReportingUtilityWait(const std::shared_ptr<MxReportingQueueCondition>& condition, const std::string& message,
                            const std::string& failureMessage, const MxLogScope* scope, double timeoutSeconds,
                            const std::shared_ptr<WorkQueue>& queue, UniqueFunction<void(bool)> done)
{
    MxReportingQueueWait::wait(condition, message, failureMessage, scope, timeoutSeconds, queue, std::move(done));
}

} // namespace mx
