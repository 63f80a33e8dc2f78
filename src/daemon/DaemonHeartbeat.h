#pragma once
// The daemon's pulse, every few seconds: systemd's watchdog is told that the I/O
// context of the connections still runs handlers, and the server queue writes the
// metrics file and systemd's status line from the status view. The watchdog is fed
// by a timer, not by the server queue, because the server queue may rightly wait a
// long time on a full disk (a declared wait: the pool lends a thread that keeps the
// timer and the connections going), and a restart then would lose what the stores
// still hold.

#include <chrono>
#include <memory>

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>
#include <asio/strand.hpp>

#include "Statistics/Service/MxReportingStatus.h"
#include "platform/WorkQueue.h"

namespace mx {

class DaemonHeartbeat {
public:
    static constexpr std::chrono::seconds kInterval{5};

    // Beats on a strand of `io`; `status` is read on `serverQueue`. The interval is
    // shortened to half the watchdog's when systemd asks for one.
    DaemonHeartbeat(asio::io_context& io, std::shared_ptr<WorkQueue> serverQueue, MxReportingStatus& status);

    // Beats now and then every interval, until stopped. Any thread.
    void start();
    void stop();

private:
    void beat();

    asio::strand<asio::io_context::executor_type> strand_;
    asio::steady_timer timer_;
    std::shared_ptr<WorkQueue> serverQueue_;
    MxReportingStatus& status_;
    std::chrono::milliseconds interval_ = kInterval;
};

} // namespace mx
