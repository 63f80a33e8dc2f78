#include "Statistics/Service/MxReportingBlockThrottle.h"

#include <algorithm>
#include <cmath>
#include <limits>

#include <asio/post.hpp>
#include <fmt/format.h>

#include "platform/MxLog.h"

namespace mx {

namespace {

using Clock = std::chrono::steady_clock;

constexpr double kDefaultSleepSeconds = 0.5;
constexpr double kMaximumSleepSeconds = 5.0;
constexpr std::int64_t kLargestWholeSeconds = 4;
constexpr auto kIdlePass = std::chrono::milliseconds(100);
constexpr auto kCompletionPoll = std::chrono::milliseconds(500);
constexpr unsigned kCompletionSeconds = 5;
constexpr int kCompletionPolls = 10;

Clock::time_point after(double seconds)
{
    // A day either way is as good as any larger delay, and keeps the clock arithmetic in range.
    seconds = std::clamp(seconds, -86400.0, 86400.0);
    return Clock::now() + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
}

// The whole part of a number, saturated at the ends of the 64-bit range.
std::int64_t wholePart(const Value& number)
{
    if (const std::uint64_t* value = number.asUInt())
        return *value > std::uint64_t(std::numeric_limits<std::int64_t>::max())
            ? std::numeric_limits<std::int64_t>::max()
            : std::int64_t(*value);
    if (const std::int64_t* value = number.asInt())
        return *value;
    double value = number.doubleValue();
    if (value >= 9.2e18)
        return std::numeric_limits<std::int64_t>::max();
    if (value <= -9.2e18)
        return std::numeric_limits<std::int64_t>::min();
    return static_cast<std::int64_t>(std::trunc(value));
}

} // namespace

std::shared_ptr<MxReportingBlockThrottle> MxReportingBlockThrottle::make()
{
    std::shared_ptr<MxReportingBlockThrottle> throttle(new MxReportingBlockThrottle);
    throttle->unscheduledTimerKeys_.reserve(6);
    // The worker holds the throttle for as long as it runs, and says when it has let
    // go: the last holder may then be the worker itself or whoever invalidated it.
    throttle->queueThread_ = std::thread([self = throttle, exit = throttle->workerExit_]() mutable {
        self->run();
        self.reset();
        std::lock_guard lock(exit->mutex);
        exit->done = true;
        exit->changed.notify_all();
    });
    return throttle;
}

MxReportingBlockThrottle::~MxReportingBlockThrottle()
{
    // Run by the worker when it held the last reference; otherwise the worker has
    // already let go and is ending.
    if (queueThread_.get_id() == std::this_thread::get_id())
        queueThread_.detach();
    else if (queueThread_.joinable())
        queueThread_.join();
}

std::string MxReportingBlockThrottle::buildMessageKey(const Dictionary& message, ReporterID reporterID,
                                                      MessageCategory category, MessageType type)
{
    std::vector<std::string> excluded = {"systemuptime_sec", "processuptime_ms", "mxreporting_timestamp",
                                         "_comparison_field_blacklist", "_throttle_seconds"};
    if (const Value* blacklist = message.find("_comparison_field_blacklist"))
        if (const Array* names = blacklist->asArray())
            for (const auto& name : *names)
                excluded.push_back(name.description());
    if (message.find("Volume") && message.find("VolumeOperationTime")) {
        excluded.emplace_back("Volume");
        excluded.emplace_back("VolumeOperationTime");
    }
    std::vector<std::string> keys;
    keys.reserve(message.size());
    for (const auto& [key, value] : message)
        keys.push_back(key);
    std::sort(keys.begin(), keys.end());

    std::string text;
    for (const auto& key : keys) {
        text += key;
        text += '|';
        text += std::find(excluded.begin(), excluded.end(), key) != excluded.end() ? std::string("^")
                                                                                   : message.find(key)->description();
        text += '|';
    }
    return text +
        fmt::format("reporterID|{}|{}|{}", reporterID, MxReportingCategoryName(category),
                    MxReportingMessageTypeName(type));
}

double MxReportingBlockThrottle::determineSleepTime(const Dictionary& message)
{
    const Value* time = message.find("_throttle_seconds");
    if (!time)
        return kDefaultSleepSeconds;
    if (!time->isNumber() || std::isnan(time->doubleValue())) {
        MXLOG(nullptr, Info, "Rejecting non KvNumber value of throttle time. {{time={}}}", time->description());
        return kDefaultSleepSeconds;
    }
    // The limit applies to the whole part: 4.9 seconds pass, 5 do not.
    if (wholePart(*time) > kLargestWholeSeconds) {
        MXLOG(nullptr, Info, "Rejecting large throttle time. {{time={}, max={:f}}}", time->description(),
              kMaximumSleepSeconds);
        return kDefaultSleepSeconds;
    }
    return static_cast<double>(static_cast<float>(time->doubleValue()));
}

void MxReportingBlockThrottle::TimerWrapper::sleepFor(double seconds) { fireDate.store(after(seconds)); }

std::shared_ptr<MxReportingBlockThrottle::TimerWrapper> MxReportingBlockThrottle::inFlight(const std::string& key) const
{
    std::lock_guard lock(timersInFlightMonitor_);
    auto found = timersInFlight_.find(key);
    return found == timersInFlight_.end() ? nullptr : found->second;
}

void MxReportingBlockThrottle::addMessageBlock(Block block, ReporterID reporterID, const Dictionary& message,
                                               MessageCategory category, MessageType type)
{
    if (invalidated_.load())
        return;
    std::string key = buildMessageKey(message, reporterID, category, type);
    double delay = determineSleepTime(message);
    // The lookup and the re-arm race a firing timer: the duplicate then either
    // replaces the delivery in time or is dropped with the entry. Accepted as designed.
    if (auto wrapper = inFlight(key)) {
        MXLOG(nullptr, Debug, "Dropping duplicate message for {}", key);
        wrapper->sleepFor(delay);
        wrapper->block.set(std::move(block));
        // A timer already on the loop learns its new date there.
        asio::post(loop_, [self = shared_from_this(), wrapper, key] {
            if (wrapper->placed && !self->invalidated_.load() && self->inFlight(key) == wrapper)
                self->wait(wrapper, key);
        });
        return;
    }
    auto wrapper = std::make_shared<TimerWrapper>();
    wrapper->block.set(std::move(block));
    wrapper->sleepFor(delay);
    wrapper->timer = std::make_unique<asio::steady_timer>(loop_);
    {
        std::lock_guard lock(timersInFlightMonitor_);
        timersInFlight_[key] = wrapper;
    }
    std::lock_guard lock(unscheduledTimerKeysMonitor_);
    unscheduledTimerKeys_.push_back(key);
}

void MxReportingBlockThrottle::run()
{
    if (!shouldKeepRunning())
        return;
    for (;;) {
        std::size_t unscheduled = 0;
        counts(unscheduled);
        if (unscheduled > 0) {
            MXLOG(nullptr, Debug, "calling workingRunLoop run from inside thread block");
            {
                std::lock_guard lock(unscheduledTimerKeysMonitor_);
                for (const auto& key : unscheduledTimerKeys_)
                    if (auto wrapper = inFlight(key))
                        place(wrapper, key);
                unscheduledTimerKeys_.clear();
            }
            runTimerLoop();
        }
        if (invalidated_.load())
            break;
        MXLOG(nullptr, Debug, "sleeping in thread");
        idle();
        if (!shouldKeepRunning())
            break;
    }
    if (invalidated_.load())
        dropHeldDeliveries();
}

// Returns once every timer placed has fired, moved ones at their new date. A
// delivery that throws ends its own firing, not the others': the loop goes on.
void MxReportingBlockThrottle::runTimerLoop()
{
    loop_.restart();
    // Checked after the restart: an invalidation's stop either came before it, and
    // is seen here, or comes after it and ends the run.
    if (invalidated_.load())
        return;
    for (;;) {
        try {
            loop_.run();
            return;
        } catch (const std::exception& error) {
            MXLOG_LIMITED(nullptr, Error, "a held delivery failed: {}", error.what());
        } catch (...) {
            MXLOG_LIMITED(nullptr, Error, "a held delivery failed");
        }
    }
}

void MxReportingBlockThrottle::idle()
{
    std::unique_lock lock(idleMutex_);
    idleWake_.wait_for(lock, kIdlePass, [&] { return invalidated_.load(); });
}

// The worker's last act after an invalidation: its timers are cancelled and their
// waits run out on its own loop (none fires a delivery), and what was held is gone.
void MxReportingBlockThrottle::dropHeldDeliveries()
{
    std::map<std::string, std::shared_ptr<TimerWrapper>> held;
    {
        std::lock_guard lock(timersInFlightMonitor_);
        held.swap(timersInFlight_);
    }
    {
        std::lock_guard lock(unscheduledTimerKeysMonitor_);
        unscheduledTimerKeys_.clear();
    }
    for (const auto& [key, wrapper] : held) {
        wrapper->timer->cancel();
        dropped_.push_back(key);
    }
    loop_.restart();
    loop_.run();
}

std::vector<std::string> MxReportingBlockThrottle::invalidate()
{
    {
        std::lock_guard lock(idleMutex_);
        invalidated_.store(true);
        shouldKeepRunning_.store(false);
    }
    idleWake_.notify_all();
    loop_.stop();
    if (queueThread_.get_id() == std::this_thread::get_id())
        return {};
    std::unique_lock lock(workerExit_->mutex);
    workerExit_->changed.wait(lock, [&] { return workerExit_->done; });
    return dropped_;
}

void MxReportingBlockThrottle::place(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key)
{
    wrapper->placed = true;
    wait(wrapper, key);
}

void MxReportingBlockThrottle::wait(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key)
{
    wrapper->timer->expires_at(wrapper->fireDate.load());
    wrapper->timer->async_wait([self = shared_from_this(), wrapper, key](const std::error_code& error) {
        if (error || self->invalidated_.load())
            return; // re-armed for a later date, or dropped
        if (Clock::now() < wrapper->fireDate.load()) {
            self->wait(wrapper, key);
            return;
        }
        self->fire(wrapper, key);
    });
}

void MxReportingBlockThrottle::fire(const std::shared_ptr<TimerWrapper>& wrapper, const std::string& key)
{
    if (inFlight(key) != wrapper)
        return; // fired already, by a wait armed before a duplicate moved it
    // The entry goes whether or not the delivery throws.
    auto cleanUp = [&] {
        std::lock_guard lock(timersInFlightMonitor_);
        if (auto found = timersInFlight_.find(key); found != timersInFlight_.end() && found->second == wrapper) {
            found->second->timer->cancel();
            timersInFlight_.erase(found);
        }
    };
    try {
        if (auto block = wrapper->block.get())
            block();
    } catch (...) {
        cleanUp();
        throw;
    }
    cleanUp();
}

std::size_t MxReportingBlockThrottle::counts(std::size_t& unscheduled) const
{
    {
        std::lock_guard lock(unscheduledTimerKeysMonitor_);
        unscheduled = unscheduledTimerKeys_.size();
    }
    std::lock_guard lock(timersInFlightMonitor_);
    return timersInFlight_.size();
}

void MxReportingBlockThrottle::waitForCompletion()
{
    std::size_t unscheduled = 0;
    std::size_t held = counts(unscheduled);
    MXLOG(nullptr, Info, "waitForCompletion. timersInFlight={} unscheduledTimerKeys={}", held, unscheduled);
    if (held == 0)
        return;
    MXLOG(nullptr, Debug, "Waiting up to {} seconds for blockThrottle queue to be empty.", kCompletionSeconds);
    for (int i = 0; i <= kCompletionPolls - 1 && counts(unscheduled) > 0; ++i)
        std::this_thread::sleep_for(kCompletionPoll);
    if (std::size_t left = counts(unscheduled))
        MXLOG(nullptr, Default, "Giving up on waiting for completion after {} seconds. timersInFlight={}",
              kCompletionSeconds, left);
}

} // namespace mx
