// The end-to-end benchmarks of the daemon, each against a bare msgpack-rpc echo
// server on the same socket type in the same run (the ceiling):
//
//   mxreporting_load [--connections N] [--in-flight K] [--seconds S] [--memory-reports N]
//     Closed loop: N connections keep K reports in flight each. Throughput, latency,
//     CPU per report (the daemon's until its stores have written everything), the
//     daemon's resident memory at start and its peak under the load; then one session
//     is sent N reports (200 000; 0 skips it) and keeps them: memory per kept report
//     against its size on the wire, and after the stop.
//   mxreporting_load --rates R[,R...] [--seconds S]
//     Open loop, one connection at each fixed rate for S seconds (10): CPU and context
//     switches per report, latency from when each report was due.
//   mxreporting_load --idle S
//     What the daemon costs with no client: wake-ups and CPU a second.
//   mxreporting_load --kill-window R [--rounds N]
//     Acknowledged reports a SIGKILL takes with it at R reports a second, counted once
//     the next start has written in what it found pending (5 rounds).
//   mxreporting_load --beside-a-flood [--in-flight K] [--seconds S]
//   mxreporting_load --full-stop
//     One client's round trips while another floods.
//
// MXREPORTING_BENCH_TALLY_JSON='{"disabled":["com"]}' gives the daemon that tally.json,
// to see what the analytics store costs; MXREPORTING_BENCH_DAEMON=PATH runs another
// build of the daemon, to compare with.

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "BenchReport.h"
#include "ClosedLoop.h"
#include "KillWindow.h"
#include "OpenLoop.h"
#include "ProcessCounters.h"
#include "Servers.h"

using namespace mx::bench;

namespace {

struct Options {
    int connections = 8;
    int inFlight = 32;
    double seconds = 0; // 0: the mode's own
    int memoryReports = 200'000;
    std::vector<double> rates;
    double idleSeconds = 0;
    double killRate = 0;
    int rounds = 5;
    bool beside = false;
    bool fullStop = false;
};

constexpr const char* kUsage =
    "usage: mxreporting_load [--connections N] [--in-flight K] [--seconds S] [--memory-reports N]\n"
    "       mxreporting_load --rates R[,R...] [--seconds S]\n"
    "       mxreporting_load --idle S\n"
    "       mxreporting_load --kill-window R [--rounds N]\n"
    "       mxreporting_load --beside-a-flood [--in-flight K] [--seconds S]\n"
    "       mxreporting_load --full-stop\n";

std::vector<double> parseRates(const std::string& text)
{
    std::vector<double> rates;
    std::stringstream list(text);
    std::string rate;
    while (std::getline(list, rate, ','))
        rates.push_back(std::stod(rate));
    return rates;
}

Options parseOptions(int argc, char** argv)
{
    Options options;
    for (int i = 1; i < argc; ++i) {
        std::string option = argv[i];
        if (option == "--full-stop") {
            options.fullStop = true;
            continue;
        }
        if (option == "--beside-a-flood") {
            options.beside = true;
            continue;
        }
        if (i + 1 >= argc)
            throw std::invalid_argument(option);
        std::string value = argv[++i];
        if (option == "--connections")
            options.connections = std::stoi(value);
        else if (option == "--in-flight")
            options.inFlight = std::stoi(value);
        else if (option == "--seconds")
            options.seconds = std::stod(value);
        else if (option == "--memory-reports")
            options.memoryReports = std::stoi(value);
        else if (option == "--rates")
            options.rates = parseRates(value);
        else if (option == "--idle")
            options.idleSeconds = std::stod(value);
        else if (option == "--kill-window")
            options.killRate = std::stod(value);
        else if (option == "--rounds")
            options.rounds = std::stoi(value);
        else
            throw std::invalid_argument(option);
    }
    return options;
}

struct Servers {
    std::filesystem::path root;
    pid_t echo = 0;
    pid_t daemon = 0;
    std::filesystem::path echoSocket() const { return root / "echo.sock"; }
};

void runClosedLoop(const Options& options, const Servers& servers)
{
    double seconds = options.seconds > 0 ? options.seconds : 5;
    auto socket = daemonSocket(servers.root);
    std::printf("closed loop: %d connections x %d in flight, %.0f s each, 9-key reports to one started session "
                "per connection\n",
                options.connections, options.inFlight, seconds);
    auto print = [](const char* name, const ClosedLoopFigures& figures, double cpu) {
        std::printf("%-8s %10.0f reports/s   p50 %8.1f us   p99 %8.1f us   CPU %6.2f us/report   errors %llu\n", name,
                    figures.reportsPerSecond, figures.p50Microseconds, figures.p99Microseconds, cpu,
                    static_cast<unsigned long long>(figures.errors));
    };
    auto before = ProcessCounters::of(servers.echo);
    auto echo = driveClosedLoop(servers.echoSocket(), options.connections, options.inFlight, seconds, false);
    double echoCpu = (ProcessCounters::of(servers.echo) - before).cpuSeconds * 1e6 / double(echo.answered);
    print("echo", echo, echoCpu);

    waitUntilStoresIdle(socket);
    long startKiB = memoryKiB(servers.daemon, "VmRSS");
    resetPeakMemory(servers.daemon);
    before = ProcessCounters::of(servers.daemon);
    auto daemon = driveClosedLoop(socket, options.connections, options.inFlight, seconds, true);
    waitUntilStoresIdle(socket);
    double daemonCpu = (ProcessCounters::of(servers.daemon) - before).cpuSeconds * 1e6 / double(daemon.answered);
    long peakKiB = memoryKiB(servers.daemon, "VmHWM");
    print("daemon", daemon, daemonCpu);
    std::printf("daemon/echo: throughput %.2f, p99 %.2f, CPU per report %.2f\n",
                daemon.reportsPerSecond / echo.reportsPerSecond, daemon.p99Microseconds / echo.p99Microseconds,
                daemonCpu / echoCpu);
    std::printf("daemon memory: %ld KiB resident before the load, peak %ld KiB under it (%+ld KiB)\n", startKiB,
                peakKiB, peakKiB - startKiB);
    if (options.memoryReports > 0)
        measureKeptMemory(socket, servers.daemon, options.memoryReports);
}

void runOpenLoops(const Options& options, const Servers& servers)
{
    double seconds = options.seconds > 0 ? options.seconds : 10;
    std::printf("open loop: one connection, 9-key reports at a fixed rate for %.0f s; latency from when each was "
                "due; CPU and switches of every thread until 1 s after the last reply\n",
                seconds);
    std::printf("%-10s %-8s %14s %16s %10s %10s %10s %7s\n", "rate", "server", "CPU us/report", "switches/report",
                "p50 us", "p99 us", "max us", "errors");
    std::int64_t reporterID = 1000;
    for (double rate : options.rates) {
        auto echo = runOpenLoop(servers.echoSocket(), servers.echo, rate, seconds, 0);
        auto daemonSocketPath = daemonSocket(servers.root);
        waitUntilStoresIdle(daemonSocketPath);
        auto daemon = runOpenLoop(daemonSocketPath, servers.daemon, rate, seconds, ++reporterID);
        for (auto [name, figures] : {std::pair{"echo", echo}, std::pair{"daemon", daemon}})
            std::printf("%-10.0f %-8s %14.1f %16.2f %10.0f %10.0f %10.0f %7llu\n", rate, name,
                        figures.cpuMicrosecondsPerReport, figures.switchesPerReport, figures.p50Microseconds,
                        figures.p99Microseconds, figures.maxMicroseconds,
                        static_cast<unsigned long long>(figures.errors));
        std::printf("%-10.0f daemon by thread (CPU us, switches per report):", rate);
        for (const auto& [name, share] : daemon.perReportByThreadName)
            std::printf(" %s %.1f %.2f;", name.c_str(), share.cpuMicroseconds, share.switches);
        std::printf("\n%-10.0f daemon/echo: CPU per report %.2f, p99 %.2f\n", rate,
                    daemon.cpuMicrosecondsPerReport / echo.cpuMicrosecondsPerReport,
                    daemon.p99Microseconds / echo.p99Microseconds);
    }
}

void runIdle(const Options& options, const Servers& servers)
{
    // Start-up work (the first metrics, the stores' first checks) is over by then.
    std::this_thread::sleep_for(std::chrono::seconds(3));
    auto before = ProcessCounters::of(servers.daemon);
    std::this_thread::sleep_for(std::chrono::duration<double>(options.idleSeconds));
    auto spent = ProcessCounters::of(servers.daemon) - before;
    std::printf("idle for %.0f s: %.2f wake-ups a second, %.3f ms of CPU a second\n", options.idleSeconds,
                static_cast<double>(spent.switches) / options.idleSeconds,
                spent.cpuSeconds * 1e3 / options.idleSeconds);
}

void runKillWindow(const Options& options, const std::filesystem::path& root)
{
    auto figures = measureKillWindow(root, options.killRate, options.rounds);
    std::printf("SIGKILL at %.0f reports/s, %d rounds: %llu of %llu acknowledged reports lost; window: longest "
                "%.1f ms, mean %.1f ms\n",
                options.killRate, figures.rounds, static_cast<unsigned long long>(figures.lost),
                static_cast<unsigned long long>(figures.acknowledged), figures.longestWindowMilliseconds,
                figures.meanWindowMilliseconds);
}

void runBeside(const Options& options, const Servers& servers)
{
    double seconds = options.seconds > 0 ? options.seconds : 5;
    for (auto [name, socket] :
         {std::pair{"echo", servers.echoSocket()}, std::pair{"daemon", daemonSocket(servers.root)}}) {
        auto figures = driveBesideAFlood(socket, options.inFlight, seconds);
        std::printf("%-8s one report every 10 ms beside a client with %d in flight: round trip p50 %.2f ms, "
                    "p95 %.2f ms, p99 %.2f ms, longest %.2f ms\n",
                    name, options.inFlight, figures.p50Microseconds / 1000, figures.p95Microseconds / 1000,
                    figures.p99Microseconds / 1000, figures.maxMicroseconds / 1000);
    }
}

void runFullStop(const Servers& servers)
{
    int kept = 0;
    double seconds = measureFullStop(daemonSocket(servers.root), kept);
    std::printf("a session that keeps all it may (%d reports of a million numbers), on an internal build: its stop "
                "took %.2f s\n",
                kept, seconds);
}

int run(const Options& options)
{
    std::string pattern = (std::filesystem::temp_directory_path() / "mxreporting-bench-XXXXXX").string();
    Servers servers;
    servers.root = mkdtemp(pattern.data());
    if (const char* tally = std::getenv("MXREPORTING_BENCH_TALLY_JSON")) {
        std::filesystem::create_directories(servers.root / "etc/harmonia");
        std::ofstream(servers.root / "etc/harmonia/tally.json") << tally;
    }
    if (options.killRate > 0) {
        runKillWindow(options, servers.root);
        std::filesystem::remove_all(servers.root);
        return 0;
    }
    if (options.fullStop) {
        // The longest stop writes a summary file too.
        std::filesystem::create_directories(servers.root / "etc/harmonia");
        std::ofstream(servers.root / "etc/harmonia/device.json") << R"({"InternalBuild": true})";
    }
    // Before this process starts any thread.
    servers.echo = forkEcho(servers.echoSocket());
    servers.daemon = spawnDaemon(servers.root);
    if (!waitForSocket(servers.echoSocket()) || !waitForSocket(daemonSocket(servers.root))) {
        std::fprintf(stderr, "servers did not come up\n");
        return 1;
    }
    if (options.idleSeconds > 0)
        runIdle(options, servers);
    else if (!options.rates.empty())
        runOpenLoops(options, servers);
    else if (options.beside)
        runBeside(options, servers);
    else if (options.fullStop)
        runFullStop(servers);
    else
        runClosedLoop(options, servers);
    endProcess(servers.echo, SIGKILL);
    endProcess(servers.daemon, SIGTERM);
    std::filesystem::remove_all(servers.root);
    return 0;
}

} // namespace

int main(int argc, char** argv)
{
    try {
        return run(parseOptions(argc, argv));
    } catch (const std::invalid_argument&) {
        std::fputs(kUsage, stderr);
        return 64;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "mxreporting_load: %s\n", error.what());
        return 1;
    }
}
