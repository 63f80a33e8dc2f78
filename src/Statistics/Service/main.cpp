// mxreportingd: installs the Linux platform services, creates the service root and
// hands it the listener; from then on the process lives on the connection thread,
// the server queue and the session queues. It ends when the platform ends it
// (SIGTERM: the stores commit what they were handed first) or when a client calls
// killService (status 2).

#include <cstdio>
#include <cstring>
#include <future>
#include <sys/resource.h>
#include <unistd.h>

#include <asio/signal_set.hpp>
#include <asio/steady_timer.hpp>
#include <curl/curl.h>
#include <systemd/sd-daemon.h>

#include "Statistics/Service/MxReportingMetrics.h"
#include "Statistics/Service/MxReportingServiceDelegate.h"
#include "Statistics/Service/MxReportingSessionSummary.h"
#include "Statistics/Service/MxReportingStatus.h"
#include "platform/linux/AsioDispatch.h"
#include "platform/linux/DatagramNotifications.h"
#include "platform/linux/DatagramOrientation.h"
#include "platform/linux/FileChanstat.h"
#include "platform/linux/InstanceLock.h"
#include "platform/linux/JournalLogSink.h"
#include "platform/linux/JsonDeviceProperties.h"
#include "platform/linux/JsonPreferences.h"
#include "platform/linux/MsgpackRpcListener.h"
#include "platform/linux/PosixFileSystem.h"
#include "platform/linux/ProcProcessTable.h"
#include "platform/linux/SpoolUplink.h"
#include "platform/linux/SqliteJoule.h"
#include "platform/linux/SqliteTally.h"
#include "platform/linux/StderrLogSink.h"
#include "platform/linux/StoreLimits.h"
#include "platform/linux/UsdtTracePoints.h"
#include "wire/RootPath.h"

using namespace mx;

namespace {

constexpr const char* kUsage = R"(usage: mxreportingd [--help] [--version]

The Harmonia reporting daemon. Every path lives under $MXREPORTING_ROOT (default /):
  run/harmonia/reporting.sock       the service endpoint (unless systemd passes one)
  run/harmonia/notify.sock          the notification endpoint
  run/harmonia/orientation.sock     the orientation feed ("device N", "ui N")
  var/lib/harmonia/                 tally.db, joule.db, uplink.db, preferences/
  etc/harmonia/                     device.json, tally.json
Verbose logging: reporting_server_verbose=5 reporting_session_verbose=5
SIGHUP re-reads the preferences; SIGTERM commits the stores and exits.
)";

// How long a shutdown waits for the queues: sessions still waiting on backend
// discovery take up to 9 s a round, and the unit's stop timeout is 90 s.
constexpr std::chrono::milliseconds kDrainBound{60'000};

// How often the metrics file and systemd's status line are brought up to date.
constexpr std::chrono::seconds kStatusInterval{5};

// Every period: the watchdog is told the connection thread lives, and the server
// queue writes the metrics file and the status line. The watchdog is fed from the
// connection thread, not the server queue, because the server queue may rightly
// wait a long time on a full disk, and a restart then would lose what it holds.
class Heartbeat {
public:
    Heartbeat(asio::io_context& io, std::shared_ptr<WorkQueue> serverQueue, MxReportingStatus& status)
        : timer_(io), serverQueue_(std::move(serverQueue)), status_(status)
    {
        std::uint64_t watchdog = 0;
        if (sd_watchdog_enabled(0, &watchdog) > 0)
            period_ = std::min(
                period_,
                std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::microseconds(watchdog / 2)));
    }

    void beat()
    {
        sd_notify(0, "WATCHDOG=1");
        serverQueue_->dispatch([&status = status_] {
            auto snapshot = status.snapshot();
            MxReportingMetrics::write(snapshot);
            sd_notify(0, ("STATUS=" + MxReportingStatus::summaryLine(snapshot)).c_str());
        });
        timer_.expires_after(period_);
        timer_.async_wait([this](const std::error_code& cancelled) {
            if (!cancelled)
                beat();
        });
    }
    void stop() { timer_.cancel(); }

private:
    asio::steady_timer timer_;
    std::shared_ptr<WorkQueue> serverQueue_;
    MxReportingStatus& status_;
    std::chrono::milliseconds period_ = kStatusInterval;
};

// Every client is a descriptor: take all the system allows, not the shell's default.
void raiseDescriptorLimit()
{
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < limit.rlim_max) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
}

[[noreturn]] void fail(const std::string& message)
{
    MXLOG(nullptr, Error, "mxreportingd cannot start: {}", message);
    // Worker threads already run: no static destructor may pull the world from under them.
    std::_Exit(1);
}

int run(int argc, char** argv)
{
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--help") == 0 || std::strcmp(argv[i], "-h") == 0) {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (std::strcmp(argv[i], "--version") == 0) {
            std::puts("mxreportingd " MXREPORTING_VERSION);
            return 0;
        }
        std::fprintf(stderr, "mxreportingd: unknown argument %s\n%s", argv[i], kUsage);
        return 64;
    }

    raiseDescriptorLimit();
    StderrLogSink stderrSink;
    JournalLogSink journalSink;
    ProcessWide<MxLogSink>::install(JournalLogSink::runningUnderJournal() ? static_cast<MxLogSink*>(&journalSink)
                                                                          : &stderrSink);
    std::string error;
    // Before the socket and the stores: a second daemon must leave the first's alone.
    auto instanceLock = InstanceLock::acquire(MxReportingPath("run/harmonia/mxreportingd.lock"), error);
    if (!instanceLock)
        fail(error);
    UsdtTracePoints tracePoints;
    ProcessWide<TracePoints>::install(&tracePoints);
    AsioDispatch dispatch;
    ProcessWide<Dispatch>::install(&dispatch);
    PosixFileSystem fileSystem;
    ProcessWide<FileSystem>::install(&fileSystem);
    JsonDeviceProperties deviceProperties(MxReportingPath("etc/harmonia/device.json"));
    ProcessWide<DeviceProperties>::install(&deviceProperties);
    DatagramOrientation orientation(MxReportingPath("run/harmonia/orientation.sock"));
    if (!orientation.listen(error))
        fail(error);
    ProcessWide<Orientation>::install(&orientation);

    auto limits = StoreLimits::read(MxReportingPath("etc/harmonia/stores.json"), error);
    if (!limits)
        fail(error);
    MxReportingSessionSummary::setRetention(limits->summaries.maxFiles, limits->summaries.maxBytes);
    auto tally = SqliteTally::open(MxReportingPath("var/lib/harmonia/tally.db"),
                                   MxReportingPath("etc/harmonia/tally.json"), limits->tally, error);
    if (!tally)
        fail(error);
    ProcessWide<Tally>::install(tally.get());
    auto joule = SqliteJoule::open(MxReportingPath("var/lib/harmonia/joule.db"), limits->joule, error);
    if (!joule)
        fail(error);
    ProcessWide<Joule>::install(joule.get());
    curl_global_init(CURL_GLOBAL_DEFAULT);
    auto uplink = SpoolUplink::open(MxReportingPath("var/lib/harmonia/uplink.db"),
                                    MxReportingPath("etc/harmonia/uplink.json"), limits->uplink, error);
    if (!uplink)
        fail(error);
    ProcessWide<Uplink>::install(uplink.get());

    ProcProcessTable processTable;
    JsonPreferences preferences(MxReportingPath("var/lib/harmonia/preferences"));
    DatagramNotifications notifications(MxReportingPath("run/harmonia/notify.sock"));

    FileChanstat chanstat(MxReportingPath("run/harmonia/chanstat"));
    auto root = MxReportingServiceDelegate::make(preferences, notifications, processTable, chanstat);
    auto listener = MsgpackRpcListener::make(MxReportingPath("run/harmonia/reporting.sock"), error);
    if (!listener)
        fail(error);
    if (!notifications.listen(listener->ioContext(), error))
        fail(error);

    std::promise<int> terminated;
    asio::signal_set reload(listener->ioContext(), SIGHUP);
    std::function<void()> waitForReload = [&] {
        reload.async_wait([&](const std::error_code& cancelled, int) {
            if (cancelled)
                return;
            notifications.deliver(kMxReportingDefaultsNotification);
            waitForReload();
        });
    };
    waitForReload();
    asio::signal_set termination(listener->ioContext(), SIGTERM, SIGINT);
    termination.async_wait([&](const std::error_code& cancelled, int signal) {
        if (!cancelled)
            terminated.set_value(signal);
    });

    MxReportingStatus status(root);
    status.addStore("tally", [&] { return tally->store().status(); });
    status.addStore("joule", [&] { return joule->store().status(); });
    status.addStore("uplink", [&] { return uplink->store().status(); });
    for (const auto& exporter : uplink->exporters())
        status.addExporter(exporter->url(), [&exporter = *exporter] { return exporter.status(); });
    root->setStatusView([&status] { return status.snapshot(); });
    Heartbeat heartbeat(listener->ioContext(), root->serverQueue(), status);

    listener->setDelegate(root);
    listener->resume();
    heartbeat.beat();
    sd_notify(0, "READY=1");
    MXLOG(nullptr, Default, "mxreportingd {} (pid {}) listening on {}; talk to it: MXREPORTING_ROOT={} mxreport demo",
          MXREPORTING_VERSION, getpid(), listener->endpointDescription(), MxReportingRoot().string());

    int signal = terminated.get_future().get();
    sd_notify(0, "STOPPING=1");
    MXLOG(nullptr, Default, "mxreportingd stopping on signal {}: taking no more requests", signal);
    auto began = std::chrono::steady_clock::now();
    // Every request already taken runs to its end, and so does the work it queued
    // (deliveries, single messages, delayed ones at once), before the stores commit.
    listener->stopReading();
    asio::post(listener->ioContext(), [&heartbeat] { heartbeat.stop(); });
    if (!dispatch.drain(kDrainBound))
        MXLOG(nullptr, Error, "queues still busy after {} s: committing what they handed over",
              kDrainBound.count() / 1000);
    tally->store().flush();
    joule->store().flush();
    uplink->store().flush();
    MXLOG(nullptr, Default, "mxreportingd stopped: everything taken is committed ({} ms)",
          std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - began).count());
    // Queues and connections are not torn down: the process simply ends.
    std::_Exit(0);
}

} // namespace

int main(int argc, char** argv)
{
    try {
        return run(argc, argv);
    } catch (const std::exception& error) {
        fail(std::string("unexpected failure: ") + error.what());
    }
}
