// mxreportingd: installs the Linux platform services, creates the service root and
// hands it the listener; from then on the process lives on its queues: the server
// queue's thread also reads and writes the connections, and the sessions' queues
// and the stores' writers have threads of their own. It ends when the platform ends it
// (SIGTERM: the stores commit what they were handed first) or when a client calls
// killService (status 2).

#include <atomic>
#include <cstdio>
#include <future>
#include <sys/resource.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <asio/signal_set.hpp>
#include <curl/curl.h>
#include <fmt/format.h>
#include <systemd/sd-daemon.h>

#include "Statistics/Service/MxReportingMetrics.h"
#include "Statistics/Service/MxReportingServiceDelegate.h"
#include "Statistics/Service/MxReportingSessionSummary.h"
#include "Statistics/Service/MxReportingStatus.h"
#include "daemon/DaemonConfiguration.h"
#include "daemon/DaemonHeartbeat.h"
#include "platform/BacklogAccount.h"
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
#include "wire/FileOwnership.h"
#include "wire/RootPath.h"

using namespace mx;

#ifdef MXREPORTING_WITH_JEMALLOC
// The allocator gives memory back to the system by itself, a few seconds after it is
// freed: a daemon idle after a busy session would otherwise keep its peak for good.
// Blocks of 64 KiB and more come from an arena of their own that gives them back as
// soon as they are freed: they are few (a session's summary at its stop, the rows and
// buffers that carry it), and kept for seconds they would not be used again, since the
// next ones are larger or fall among the small blocks left by the period just dropped.
extern "C" {
// NOLINTNEXTLINE(bugprone-reserved-identifier, cppcoreguidelines-avoid-non-const-global-variables)
const char* malloc_conf = "background_thread:true,dirty_decay_ms:5000,muzzy_decay_ms:5000,oversize_threshold:65536";
}
#endif

namespace {

constexpr const char* kDescription =
    "mxreportingd: the Harmonia audio reporting daemon. Audio components connect to it on its Unix socket, open\n"
    "reporting sessions and send usage and quality reports. Each report becomes an analytics event (tally.db), a\n"
    "power log event when it carries an engine-on time (joule.db), and a message of its session in the backend\n"
    "spool (uplink.db), from which the collectors listed in uplink.json are fed.";

// The help's sections after the options. --help prints "Title:" headings; the manual
// page is made by help2man from --help-man, where "*Title*" makes each its own section.
struct HelpSection {
    const char* title;
    const char* body;
};

constexpr HelpSection kHelpSections[] = {
    {"Files", R"(  Every path is under $MXREPORTING_ROOT (default /).
  run/harmonia/reporting.sock       the service endpoint (unless systemd passes one)
  run/harmonia/notify.sock          the notification endpoint
  run/harmonia/orientation.sock     the orientation feed ("device N", "ui N")
  var/lib/harmonia/                 tally.db, joule.db, uplink.db (each with its rows not
                                    yet committed in a -pending file beside it), preferences/
  var/lib/harmonia/metrics/         mxreportingd.prom, the status counters for Prometheus
  etc/harmonia/                     device.json, tally.json, uplink.json, stores.json:
                                    see mxreportingd.conf(5) and the examples in
                                    /usr/share/doc/mxreportingd/examples/
  var/log/harmonia/reporting/       session summary files (internal builds))"},
    {"Environment", R"(  MXREPORTING_ROOT                  the directory every path above is under
  reporting_server_verbose=5        log every request
  reporting_session_verbose=5       log every session's reports)"},
    {"Signals", R"(  SIGHUP                            read etc/harmonia/ and the preferences again; a
                                    configuration with errors is refused and the one
                                    in use kept (systemctl reload mxreportingd)
  SIGTERM, SIGINT                   take no more requests, commit everything taken to
                                    the stores, remove the metrics file, exit 0)"},
    {"Exit status", R"(  0                                 stopped by SIGTERM or SIGINT; or --check-config
                                    found the configuration good
  1                                 cannot start (the log says what to mend); or
                                    --check-config found errors, each printed
  2                                 a client asked it to stop (killService); systemd
                                    does not restart it
  64                                bad command-line usage)"},
    {"See also", "  mxreport(1), mxreportingd.conf(5), mxreporting(3); what it does now: mxreport status"},
};

std::string helpFooter(bool forManual)
{
    std::string footer;
    for (const auto& section : kHelpSections)
        footer += forManual ? fmt::format("\n*{}*\n{}\n", section.title, section.body)
                            : fmt::format("\n{}:\n{}\n", section.title, section.body);
    return footer;
}

// How long a stop takes at most, whatever the stores do: first the queues run what was
// taken, then the stores commit what they can. What they cannot stays in the pending
// rows for the next start. Sessions still waiting on backend discovery are not waited
// for: their reports were not answered yet.
constexpr std::chrono::seconds kStopBound{10};
constexpr std::chrono::seconds kDrainBound{6};

// Every client is a descriptor: take all the system allows, not the shell's default.
void raiseDescriptorLimit()
{
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < limit.rlim_max) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
}

int checkConfiguration()
{
    std::vector<std::string> errors;
    if (DaemonConfiguration::read(errors)) {
        std::printf("mxreportingd: the configuration in %s is good\n", MxReportingPath("etc/harmonia").c_str());
        return 0;
    }
    for (const auto& error : errors)
        std::fprintf(stderr, "%s\n", error.c_str());
    return 1;
}

std::string joined(const std::vector<std::string>& errors)
{
    std::string text;
    for (const auto& error : errors)
        text += (text.empty() ? "" : "; ") + error;
    return text;
}

[[noreturn]] void fail(const std::string& message)
{
    MXLOG_LIMITED(nullptr, Error, "mxreportingd cannot start (running as user {}, group {}): {}", userName(geteuid()),
                  groupName(getegid()), message);
    // Worker threads already run: no static destructor may pull the world from under them.
    std::_Exit(1);
}

// SIGHUP: the configuration read again and put to use, unless it has errors.
void reconfigure(SqliteTally& tally, SqliteJoule& joule, SpoolUplink& uplink)
{
    std::vector<std::string> errors;
    auto configuration = DaemonConfiguration::read(errors);
    if (!configuration) {
        for (const auto& error : errors)
            MXLOG_LIMITED(nullptr, Error, "configuration refused: {}", error);
        MXLOG_LIMITED(nullptr, Error, "keeping the configuration in use");
        return;
    }
    const auto& limits = configuration->limits;
    tally.reconfigure(configuration->disabledEvents, limits.tally);
    joule.store().setRetention(eventsRetention(limits.joule));
    uplink.reconfigure(configuration->backends, limits.uplink);
    MxReportingSessionSummary::setRetention(limits.summaries.maxFiles, limits.summaries.maxBytes);
    MXLOG_LIMITED(nullptr, Default, "configuration read again: {} collectors, {} disabled event names",
                  configuration->backends.collectors.size(), configuration->disabledEvents.size());
}

int run(int argc, char** argv)
{
    CLI::App options(kDescription, "mxreportingd");
    options.set_version_flag("--version", "mxreportingd " MXREPORTING_VERSION);
    bool check = false;
    options.add_flag("--check-config", check,
                     "Check the configuration in etc/harmonia/ and exit: 0, or 1 with every error found");
    bool helpForManual = false;
    options.add_flag("--help-man", helpForManual)->group("");
    options.footer(helpFooter(false));
    try {
        options.parse(argc, argv);
        if (helpForManual) {
            options.footer(helpFooter(true));
            std::fputs(options.help().c_str(), stdout);
            return 0;
        }
    } catch (const CLI::Success& done) {
        return options.exit(done);
    } catch (const CLI::ParseError& wrong) {
        options.exit(wrong);
        return 64;
    }
    if (check)
        return checkConfiguration();

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

    std::vector<std::string> errors;
    auto configuration = DaemonConfiguration::read(errors);
    if (!configuration)
        fail(joined(errors));
    const StoreLimits& limits = configuration->limits;
    MxReportingSessionSummary::setRetention(limits.summaries.maxFiles, limits.summaries.maxBytes);
    // Stores that cannot be written now are opened all the same: the daemon serves, and
    // they try again.
    auto tally =
        SqliteTally::open(MxReportingPath("var/lib/harmonia/tally.db"), configuration->disabledEvents, limits.tally);
    ProcessWide<Tally>::install(tally.get());
    auto joule = SqliteJoule::open(MxReportingPath("var/lib/harmonia/joule.db"), limits.joule);
    ProcessWide<Joule>::install(joule.get());
    curl_global_init(CURL_GLOBAL_DEFAULT);
    auto uplink =
        SpoolUplink::open(MxReportingPath("var/lib/harmonia/uplink.db"), configuration->backends, limits.uplink);
    ProcessWide<Uplink>::install(uplink.get());

    ProcProcessTable processTable;
    JsonPreferences preferences(MxReportingPath("var/lib/harmonia/preferences"));
    DatagramNotifications notifications(MxReportingPath("run/harmonia/notify.sock"));

    FileChanstat chanstat(MxReportingPath("run/harmonia/chanstat"));
    auto root = MxReportingServiceDelegate::make(preferences, notifications, processTable, chanstat);
    auto listener =
        MsgpackRpcListener::make(MxReportingPath("run/harmonia/reporting.sock"), dispatch.interactiveContext(), error);
    if (!listener)
        fail(error);
    if (!notifications.listen(dispatch.interactiveContext(), error))
        fail(error);

    std::promise<int> terminated;
    asio::signal_set reload(dispatch.interactiveContext(), SIGHUP);
    // Set from a SIGHUP until its reconfiguration starts: a storm of them is one more
    // reading of the files after the last, not one each.
    std::atomic<bool> reloadWaiting{false};
    std::function<void()> waitForReload = [&] {
        reload.async_wait([&](const std::error_code& cancelled, int) {
            if (cancelled)
                return;
            // Off the server queue's thread: a collector no longer listed may take
            // a while to stop.
            if (!reloadWaiting.exchange(true))
                dispatch.globalQueue(QueuePriority::Utility).dispatch([&] {
                    reloadWaiting.store(false);
                    reconfigure(*tally, *joule, *uplink);
                    notifications.deliver(kMxReportingDefaultsNotification);
                });
            waitForReload();
        });
    };
    waitForReload();
    asio::signal_set termination(dispatch.interactiveContext(), SIGTERM, SIGINT);
    termination.async_wait([&](const std::error_code& cancelled, int signal) {
        if (!cancelled)
            terminated.set_value(signal);
    });

    MxReportingStatus status(root);
    status.addStore("tally", [&] { return tally->store().status(); });
    status.addStore("joule", [&] { return joule->store().status(); });
    status.addStore("uplink", [&] { return uplink->store().status(); });
    status.setExporters([&] { return uplink->exportersStatus(); });
    root->setStatusView([&status] { return status.snapshot(); });
    DaemonHeartbeat heartbeat(dispatch.interactiveContext(), root->serverQueue(), status);

    listener->setDelegate(root);
    listener->resume();
    heartbeat.start();
    sd_notify(0, "READY=1");
    MXLOG_LIMITED(nullptr, Default,
                  "mxreportingd {} (pid {}) listening on {}; talk to it: MXREPORTING_ROOT={} mxreport demo",
                  MXREPORTING_VERSION, getpid(), listener->endpointDescription(), MxReportingRoot().string());

    int signal = terminated.get_future().get();
    sd_notify(0, "STOPPING=1");
    MXLOG_LIMITED(nullptr, Default, "mxreportingd stopping on signal {}: taking no more requests", signal);
    auto began = std::chrono::steady_clock::now();
    // Every request already taken runs to its end, and so does the work it queued
    // (deliveries, single messages, delayed ones at once), before the stores commit.
    listener->stopReading();
    heartbeat.stop();
    // Clients held back by what they owe run what they sent, too: no more comes.
    BacklogAccount::forgiveAll();
    if (!dispatch.drain(kDrainBound))
        MXLOG_LIMITED(nullptr, Error, "queues still busy after {} s: committing what they handed over",
                      kDrainBound.count());
    SqliteStore::Uncommitted left;
    for (SqliteStore* store : {&tally->store(), &joule->store(), &uplink->store()})
        left += store->flush(began + kStopBound);
    MxReportingMetrics::remove();
    auto took = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - began).count();
    if (left.kept + left.inMemory == 0)
        MXLOG_LIMITED(nullptr, Default, "mxreportingd stopped: everything taken is committed ({} ms)", took);
    else
        MXLOG_LIMITED(nullptr, Error,
                      "mxreportingd stopped after {} ms with {} rows the stores could not commit: {} stay in the "
                      "pending rows for the next start, {} held in memory alone are lost",
                      took, left.kept + left.inMemory, left.kept, left.inMemory);
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
