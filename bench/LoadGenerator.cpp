// The end-to-end load benchmark: N client connections, each with a started session
// and k report requests in flight, against the real daemon (full path through
// sinks, session and stores), and in the same run against a bare msgpack-rpc echo
// server on the same socket type as the ceiling. Prints reports/s, p50/p99 reply
// latency, each server's CPU time per report (the daemon's until its stores have
// written everything), the daemon's peak memory and the ratios to the echo.
//
//   mxreporting_load [--connections N] [--in-flight K] [--seconds S] [--memory-reports N]
// Then one session is sent N reports (200 000; 0 skips it) and keeps them: the
// daemon's memory per kept report against its size on the wire, and after the stop.
//   MXREPORTING_BENCH_TALLY_JSON='{"disabled":["com"]}' gives the daemon that tally.json, to
//   see what the analytics store costs.

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>
#include <mutex>
#include <random>
#include <sstream>
#include <string>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "EchoServer.h"
#include <mxreporting/mxreporting.hpp>
#include <nlohmann/json.hpp>

#include "wire/MsgpackRpcMessage.h"
#include "wire/MxReportingMethods.h"

using namespace mx;
using Clock = std::chrono::steady_clock;

namespace {

struct Options {
    int connections = 8;
    int inFlight = 32;
    double seconds = 5;
    int memoryReports = 200'000;
    bool beside = false;
};

struct Figures {
    double reportsPerSecond = 0;
    double p50Microseconds = 0;
    double p95Microseconds = 0;
    double p99Microseconds = 0;
    double maxMicroseconds = 0;
    std::uint64_t errors = 0;
    std::uint64_t answered = 0;
    double cpuMicrosecondsPerReport = 0;
};

Dictionary realisticPayload(std::mt19937& random, int seq)
{
    static const char* routes[] = {"Speaker", "Headphones", "BluetoothA2DP", "CarPlay"};
    Dictionary payload{
        {"sample_rate", (random() % 2) ? 48000 : 44100},
        {"route", routes[random() % 4]},
        {"buffer_frames", 512},
        {"underruns", static_cast<int>(random() % 3)},
        {"peak level", -12.5 + static_cast<double>(random() % 100) / 10.0},
        {"codec", "aac"},
        {"seq", seq},
    };
    if (seq % 4 == 0)
        payload.set("EngineOnTime", 1.5);
    if (seq % 2 == 0)
        payload.set("mxreporting_timestamp", static_cast<std::int64_t>(std::time(nullptr)));
    return payload;
}

// A payload as the library takes it.
mxr::Payload payloadOf(const Dictionary& dictionary)
{
    mxr::Payload payload;
    for (const auto& [key, value] : dictionary) {
        if (const std::int64_t* integer = value.asInt())
            payload.add(key.c_str(), *integer);
        else if (const double* real = value.asDouble())
            payload.add(key.c_str(), *real);
        else if (const std::string* text = value.asString())
            payload.add(key.c_str(), *text);
        else if (const bool* flag = value.asBool())
            payload.add(key.c_str(), *flag);
    }
    return payload;
}

// A client of the library on `socket`, or the end of the benchmark.
std::unique_ptr<mxr::Client> connectOrExit(const std::filesystem::path& socket)
{
    auto client = std::make_unique<mxr::Client>(socket.c_str());
    if (!client->open()) {
        std::fprintf(stderr, "cannot connect to %s: %s\n", socket.c_str(), mxr::errorText(client->error()).c_str());
        std::_Exit(1); // the clients already connected run threads of their own
    }
    return client;
}

void startSession(mxr::Client& client, std::int64_t id)
{
    mxr::Payload configuration;
    configuration.add("HostApplicationDisplayID", "bench");
    client.createSession(id);
    client.setServiceType(id, 7);
    client.setConfiguration(id, configuration);
    client.startSession(id);
}

bool waitForSocket(const std::filesystem::path& path)
{
    auto deadline = Clock::now() + std::chrono::seconds(20);
    while (Clock::now() < deadline) {
        if (mxr::Client(path.c_str()).open())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

// Keeps `inFlight` requests outstanding on every connection for `seconds`.
Figures drive(const std::filesystem::path& socket, const Options& options, bool withSessions)
{
    std::vector<std::unique_ptr<mxr::Client>> clients;
    for (int c = 0; c < options.connections; ++c) {
        auto client = connectOrExit(socket);
        if (withSessions)
            startSession(*client, c + 1);
        clients.push_back(std::move(client));
    }

    std::atomic<bool> running{true};
    std::atomic<std::uint64_t> completed{0}, errors{0};
    std::mutex latencyMutex;
    std::vector<double> latencies;
    latencies.reserve(4'000'000);

    struct Lane {
        mxr::Client* client;
        std::int64_t id;
        std::mt19937 random;
        int seq = 0;
    };
    std::vector<std::unique_ptr<Lane>> lanes;
    lanes.reserve(std::size_t(options.connections));
    for (int c = 0; c < options.connections; ++c)
        lanes.push_back(std::make_unique<Lane>(Lane{clients[c].get(), c + 1, std::mt19937(c)}));

    std::function<void(Lane&)> issue = [&](Lane& lane) {
        if (!running)
            return;
        auto payload = payloadOf(realisticPayload(lane.random, lane.seq++));
        auto sent = Clock::now();
        lane.client->sendAsync(
            payload, 0x08000003, 1, std::vector<std::int64_t>{lane.id}, [&, sent, lanePointer = &lane](int result) {
                double micros = std::chrono::duration<double, std::micro>(Clock::now() - sent).count();
                if (result < 0)
                    ++errors;
                ++completed;
                {
                    std::lock_guard lock(latencyMutex);
                    latencies.push_back(micros);
                }
                issue(*lanePointer);
            });
    };

    auto began = Clock::now();
    for (auto& lane : lanes)
        for (int k = 0; k < options.inFlight; ++k)
            issue(*lane);
    std::this_thread::sleep_for(std::chrono::duration<double>(options.seconds));
    running = false;
    double elapsed = std::chrono::duration<double>(Clock::now() - began).count();
    std::uint64_t done = completed.load();
    // Let the requests still in flight come back before the clients go.
    std::this_thread::sleep_for(std::chrono::milliseconds(500));

    Figures figures;
    figures.reportsPerSecond = static_cast<double>(done) / elapsed;
    figures.errors = errors;
    figures.answered = completed;
    std::lock_guard lock(latencyMutex);
    std::sort(latencies.begin(), latencies.end());
    if (!latencies.empty()) {
        figures.p50Microseconds = latencies[latencies.size() / 2];
        figures.p99Microseconds = latencies[std::min(latencies.size() - 1, latencies.size() * 99 / 100)];
    }
    return figures;
}

// One client floods (`inFlight` requests outstanding, as fast as it is answered) while
// another sends one report every 10 ms and waits for each reply: the other's round
// trips, which back-pressure on the flooder alone must leave short.
Figures driveBeside(const std::filesystem::path& socket, const Options& options)
{
    auto flooder = connectOrExit(socket);
    auto bystander = connectOrExit(socket);
    startSession(*flooder, 1);
    startSession(*bystander, 2);
    std::atomic<bool> running{true};
    std::mt19937 random(1);
    int seq = 0;
    std::function<void()> flood = [&] {
        if (running)
            flooder->sendAsync(payloadOf(realisticPayload(random, seq++)), 0x08000003, 1, std::vector<std::int64_t>{1},
                               [&](int) { flood(); });
    };
    for (int k = 0; k < options.inFlight; ++k)
        flood();
    std::vector<double> latencies;
    std::mt19937 own(2);
    auto end = Clock::now() + std::chrono::duration<double>(options.seconds);
    while (Clock::now() < end) {
        auto sent = Clock::now();
        bystander->send(payloadOf(realisticPayload(own, 0)), 0x08000003, 1, {2});
        latencies.push_back(std::chrono::duration<double, std::micro>(Clock::now() - sent).count());
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    running = false;
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    std::sort(latencies.begin(), latencies.end());
    Figures figures;
    figures.p50Microseconds = latencies[latencies.size() / 2];
    figures.p95Microseconds = latencies[latencies.size() * 95 / 100];
    figures.p99Microseconds = latencies[latencies.size() * 99 / 100];
    figures.maxMicroseconds = latencies.back();
    return figures;
}

// A field of /proc/PID/status in KiB ("VmHWM", "VmRSS").
long memoryKiB(pid_t pid, const std::string& field)
{
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line))
        if (line.rfind(field + ":", 0) == 0)
            return std::stol(line.substr(field.size() + 1));
    return -1;
}

// User and system time of a process so far, from /proc/PID/stat.
double cpuSeconds(pid_t pid)
{
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    // Fields after the command name, which may hold spaces: state is the 3rd field,
    // utime the 14th and stime the 15th.
    std::istringstream fields(text.substr(text.rfind(')') + 2));
    std::string field;
    double ticks = 0;
    for (int number = 3; number <= 15 && fields >> field; ++number)
        if (number >= 14)
            ticks += std::stod(field);
    return ticks / static_cast<double>(sysconf(_SC_CLK_TCK));
}

std::size_t wireSize(const Dictionary& payload)
{
    msgpack::sbuffer buffer;
    encodeRpcRequest(buffer, 1, method::kSendMessage,
                     Array({Value(payload), Value(0x08000003), Value(1), Value(Array({Value(1)}))}));
    return buffer.size();
}

// Whether every store has written what it was handed.
bool storesIdle(mxr::Client& client)
{
    std::string text;
    if (client.status(text) < 0)
        return false;
    auto status = nlohmann::json::parse(text, nullptr, false);
    if (!status.is_object() || !status.contains("stores"))
        return false;
    for (const auto& [name, store] : status["stores"].items())
        if (store.value("queue_depth", 0) != 0)
            return false;
    return true;
}

void waitUntilStoresIdle(mxr::Client& client)
{
    while (!storesIdle(client))
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
}

// One started session is sent `reports` reports and keeps them all until its stop:
// the daemon's growth per report against the report's size on the wire, and how far
// its memory comes back once the session is gone.
void measureMemory(const std::filesystem::path& socket, pid_t daemon, int reports)
{
    auto client = connectOrExit(socket);
    startSession(*client, 100);
    waitUntilStoresIdle(*client);
    long before = memoryKiB(daemon, "VmRSS");

    std::mt19937 random(7);
    std::size_t wireBytes = 0;
    std::atomic<int> answered{0};
    for (int seq = 0; seq < reports; ++seq) {
        auto payload = realisticPayload(random, seq);
        wireBytes += wireSize(payload);
        client->sendAsync(payloadOf(payload), 0x08000003, 1, std::vector<std::int64_t>{100}, [&](int) { ++answered; });
        while (seq - answered.load() > 256)
            std::this_thread::yield();
    }
    while (answered.load() < reports)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    waitUntilStoresIdle(*client);
    // What the requests' handling freed goes back to the system within the
    // allocator's decay time; what is left is what the session keeps.
    std::this_thread::sleep_for(std::chrono::seconds(6));
    long kept = memoryKiB(daemon, "VmRSS");
    double perReport = static_cast<double>(kept - before) * 1024 / reports;
    double wire = static_cast<double>(wireBytes) / reports;
    std::printf("memory: %d reports kept by one session: %.0f bytes each (wire %.0f bytes, ratio %.2f); "
                "RSS %ld -> %ld KiB\n",
                reports, perReport, wire, perReport / wire, before, kept);

    client->stopSession(100);
    client->destroySession(100);
    client.reset();
    auto stopped = Clock::now();
    for (int second : {1, 5, 15, 30}) {
        std::this_thread::sleep_until(stopped + std::chrono::seconds(second));
        std::printf("memory: %2d s after the stop: RSS %ld KiB\n", second, memoryKiB(daemon, "VmRSS"));
    }
}

void print(const char* name, const Figures& figures)
{
    std::printf("%-8s %12.0f reports/s   p50 %8.1f us   p99 %8.1f us   CPU %5.2f us/report   errors %llu\n", name,
                figures.reportsPerSecond, figures.p50Microseconds, figures.p99Microseconds,
                figures.cpuMicrosecondsPerReport, static_cast<unsigned long long>(figures.errors));
}

// Throughput, latency and CPU per report of both servers under the same closed-loop
// load, memory per kept report first.
void runLoad(const Options& options, pid_t echo, const std::filesystem::path& echoSocket, pid_t daemon,
             const std::filesystem::path& daemonSocket)
{
    // First, while the daemon has allocated nothing else.
    if (options.memoryReports > 0)
        measureMemory(daemonSocket, daemon, options.memoryReports);
    std::printf("%d connections x %d in flight, %.0f s each, 7-key reports (sendMessage to one started session)\n",
                options.connections, options.inFlight, options.seconds);
    double cpuBefore = cpuSeconds(echo);
    Figures ceiling = drive(echoSocket, options, false);
    ceiling.cpuMicrosecondsPerReport = (cpuSeconds(echo) - cpuBefore) * 1e6 / static_cast<double>(ceiling.answered);
    print("echo", ceiling);
    cpuBefore = cpuSeconds(daemon);
    Figures daemonFigures = drive(daemonSocket, options, true);
    {
        mxr::Client client(daemonSocket.c_str());
        if (client.open())
            waitUntilStoresIdle(client);
    }
    daemonFigures.cpuMicrosecondsPerReport =
        (cpuSeconds(daemon) - cpuBefore) * 1e6 / static_cast<double>(daemonFigures.answered);
    print("daemon", daemonFigures);
    std::printf("daemon/echo: throughput %.2f, p99 %.2f, CPU per report %.2f; daemon peak memory %ld KiB\n",
                daemonFigures.reportsPerSecond / ceiling.reportsPerSecond,
                daemonFigures.p99Microseconds / ceiling.p99Microseconds,
                daemonFigures.cpuMicrosecondsPerReport / ceiling.cpuMicrosecondsPerReport, memoryKiB(daemon, "VmHWM"));
}

} // namespace

int main(int argc, char** argv)
{
    Options options;
    for (int i = 1; i + 1 < argc; i += 2) {
        std::string option = argv[i];
        if (option == "--connections")
            options.connections = std::stoi(argv[i + 1]);
        else if (option == "--in-flight")
            options.inFlight = std::stoi(argv[i + 1]);
        else if (option == "--seconds")
            options.seconds = std::stod(argv[i + 1]);
        else if (option == "--memory-reports")
            options.memoryReports = std::stoi(argv[i + 1]);
        else if (option == "--beside-a-flood")
            options.beside = std::string(argv[i + 1]) == "yes";
        else {
            std::fprintf(stderr,
                         "usage: mxreporting_load [--connections N] [--in-flight K] [--seconds S] "
                         "[--memory-reports N] [--beside-a-flood yes]\n");
            return 64;
        }
    }
    std::string pattern = (std::filesystem::temp_directory_path() / "mxreporting-bench-XXXXXX").string();
    std::filesystem::path root = mkdtemp(pattern.data());
    if (const char* tally = std::getenv("MXREPORTING_BENCH_TALLY_JSON")) {
        std::filesystem::create_directories(root / "etc/harmonia");
        std::ofstream(root / "etc/harmonia/tally.json") << tally;
    }

    // Both servers are forked before this process starts any thread.
    std::filesystem::path echoSocket = root / "echo.sock";
    pid_t echo = fork();
    if (echo == 0)
        bench::runEchoServer(echoSocket);
    pid_t daemon = fork();
    if (daemon == 0) {
        // The child of a process that has started no thread yet.
        setenv("MXREPORTING_ROOT", root.c_str(), 1); // NOLINT(concurrency-mt-unsafe)
        unsetenv("JOURNAL_STREAM");                  // NOLINT(concurrency-mt-unsafe)
        freopen((root / "daemon.log").c_str(), "w", stderr);
        execl(MXREPORTINGD_PATH, MXREPORTINGD_PATH, nullptr);
        _exit(127);
    }
    std::filesystem::path daemonSocket = root / "run/harmonia/reporting.sock";
    if (!waitForSocket(echoSocket) || !waitForSocket(daemonSocket)) {
        std::fprintf(stderr, "servers did not come up\n");
        return 1;
    }

    if (options.beside) {
        for (auto [name, socket] : {std::pair{"echo", echoSocket}, std::pair{"daemon", daemonSocket}}) {
            Figures figures = driveBeside(socket, options);
            std::printf("%-8s one report every 10 ms beside a client with %d in flight: round trip p50 %.2f ms, "
                        "p95 %.2f ms, p99 %.2f ms, longest %.2f ms\n",
                        name, options.inFlight, figures.p50Microseconds / 1000, figures.p95Microseconds / 1000,
                        figures.p99Microseconds / 1000, figures.maxMicroseconds / 1000);
        }
    } else {
        runLoad(options, echo, echoSocket, daemon, daemonSocket);
    }
    ::kill(echo, SIGKILL);
    ::kill(daemon, SIGTERM);
    waitpid(echo, nullptr, 0);
    waitpid(daemon, nullptr, 0);
    std::filesystem::remove_all(root);
    return 0;
}
