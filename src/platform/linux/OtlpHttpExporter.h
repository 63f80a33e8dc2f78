#pragma once
// Exports what the spool holds to an OpenTelemetry collector as OTLP/JSON logs over
// HTTP: one-shot messages and realtime sessions' messages as soon as they are
// spooled, a batch session's messages once the session is flushed. What the
// collector has not acknowledged stays in the spool and is sent again, with
// exponential backoff that honours Retry-After, so a collector that is down loses
// nothing. One thread per exporter; it reads the spool on a connection of its own,
// opened again whenever the store makes the spool anew.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <sys/types.h>
#include <thread>
#include <vector>

#include "platform/UniqueFunction.h"
#include "platform/Uplink.h"
#include "platform/linux/OtlpCollector.h"

struct sqlite3;

namespace mx {

class OtlpHttpExporter : public std::enable_shared_from_this<OtlpHttpExporter> {
public:
    OtlpHttpExporter(std::filesystem::path spool, OtlpCollector collector);
    ~OtlpHttpExporter();
    OtlpHttpExporter(const OtlpHttpExporter&) = delete;
    OtlpHttpExporter& operator=(const OtlpHttpExporter&) = delete;

    const std::string& url() const { return collector_.url; }
    const OtlpCollector& collector() const { return collector_; }
    // Whether the collector answered an HTTP request (any status) in the last few
    // seconds, a probe's or an export's: nothing when it was not asked lately.
    std::optional<bool> answeredLately() const;
    // Asks the collector whether it answers an HTTP request at all (any status), unless
    // it was asked lately, and tells `answered`: at once, or from the global utility
    // queue once the one probe in flight for every asker has its answer (a few seconds
    // at most). Callable from any thread; must be held by a shared_ptr.
    void probe(UniqueFunction<void(bool)> answered);
    // Asks for an export pass now rather than at the next poll.
    void wake();
    // Waits (at most `timeout`) until every spooled message of `session` has been
    // acknowledged; the export error otherwise.
    std::optional<UplinkError> waitForSession(std::int64_t session, std::chrono::milliseconds timeout);
    // The error of the last failed export while the collector has not yet recovered.
    std::optional<UplinkError> currentError() const;
    // How far behind the collector is: "unacknowledged" (messages due for export and
    // not yet acknowledged), "oldest_seconds" (the age of the oldest), "last_error"
    // ("" while exports succeed). Measured by the exporter every few seconds.
    Dictionary status() const;

private:
    void run();
    // One batch; the number of messages acknowledged, or the error.
    std::optional<UplinkError> exportBatch(std::size_t& exported);
    // The spool's file opened, again if the store made it anew; false while it cannot be.
    bool openSpool();
    void measureLag();
    // Under the lock: the collector was asked something, and answered with `status`
    // (0: no answer at all).
    void noteAsked(long status);
    // `status` is the HTTP status, 0 when no response came at all.
    std::optional<UplinkError> post(void* curl, const std::string& body, std::chrono::milliseconds timeout,
                                    std::chrono::seconds& retryAfter, long& status);

    std::filesystem::path spool_;
    const OtlpCollector collector_;
    sqlite3* database_ = nullptr; // exporter thread only, as are the two below
    dev_t spoolDevice_ = 0;
    ino_t spoolInode_ = 0;
    void* handle_ = nullptr;                              // the exporter thread's curl handle
    std::chrono::seconds retryAfter_{0};                  // exporter thread only
    std::chrono::steady_clock::time_point lagMeasured_{}; // exporter thread only

    mutable std::mutex mutex_;
    std::condition_variable changed_;
    bool stopping_ = false;
    bool woken_ = false;
    std::optional<UplinkError> error_;
    std::int64_t unacknowledged_ = 0;
    double oldestUnacknowledged_ = 0; // seconds since the epoch; 0 when none
    std::uint64_t passes_ = 0;
    std::set<std::int64_t> deliveredSessions_;
    std::optional<std::chrono::steady_clock::time_point> lastAsked_;    // a probe or an export post
    std::optional<std::chrono::steady_clock::time_point> lastAnswered_; // any HTTP status
    bool probing_ = false;
    std::vector<UniqueFunction<void(bool)>> probeWaiters_;
    std::thread thread_;
};

} // namespace mx
