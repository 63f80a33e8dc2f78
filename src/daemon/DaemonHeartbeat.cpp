#include "daemon/DaemonHeartbeat.h"

#include <asio/post.hpp>
#include <systemd/sd-daemon.h>

#include "Statistics/Service/MxReportingMetrics.h"

namespace mx {

DaemonHeartbeat::DaemonHeartbeat(asio::io_context& io, std::shared_ptr<WorkQueue> serverQueue,
                                 MxReportingStatus& status)
    : strand_(asio::make_strand(io)), timer_(strand_), serverQueue_(std::move(serverQueue)), status_(status)
{
    std::uint64_t watchdog = 0;
    if (sd_watchdog_enabled(0, &watchdog) > 0)
        interval_ = std::min(
            interval_, std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::microseconds(watchdog / 2)));
}

void DaemonHeartbeat::start()
{
    asio::post(strand_, [this] { beat(); });
}

void DaemonHeartbeat::stop()
{
    asio::post(strand_, [this] { timer_.cancel(); });
}

void DaemonHeartbeat::beat()
{
    sd_notify(0, "WATCHDOG=1");
    serverQueue_->dispatch([&status = status_] {
        auto snapshot = status.snapshot();
        MxReportingMetrics::write(snapshot);
        sd_notify(0, ("STATUS=" + MxReportingStatus::summaryLine(snapshot)).c_str());
    });
    timer_.expires_after(interval_);
    timer_.async_wait([this](const std::error_code& cancelled) {
        if (!cancelled)
            beat();
    });
}

} // namespace mx
