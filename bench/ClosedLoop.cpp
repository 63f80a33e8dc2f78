#include "ClosedLoop.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <functional>
#include <memory>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

#include <mxreporting/mxreporting.hpp>
#include <nlohmann/json.hpp>

#include "BenchReport.h"
#include "ProcessCounters.h"
#include "wire/MsgpackRpcMessage.h"
#include "wire/MxReportingMethods.h"

namespace mx::bench {

namespace {

using Clock = std::chrono::steady_clock;

std::unique_ptr<mxr::Client> connectOrExit(const std::filesystem::path& socket)
{
    auto client = std::make_unique<mxr::Client>(socket.c_str());
    if (!client->open()) {
        std::fprintf(stderr, "cannot connect to %s: %s\n", socket.c_str(), mxr::errorText(client->error()).c_str());
        std::_Exit(1); // the clients already connected run threads of their own
    }
    return client;
}

void sortInto(ClosedLoopFigures& figures, std::vector<double>& latencies)
{
    std::sort(latencies.begin(), latencies.end());
    if (latencies.empty())
        return;
    auto at = [&](std::size_t percent) {
        return latencies[std::min(latencies.size() - 1, latencies.size() * percent / 100)];
    };
    figures.p50Microseconds = at(50);
    figures.p95Microseconds = at(95);
    figures.p99Microseconds = at(99);
    figures.maxMicroseconds = latencies.back();
}

// Until `done` reaches `target`, or 30 seconds.
void waitFor(const std::atomic<std::uint64_t>& done, const std::atomic<std::uint64_t>& target)
{
    auto deadline = Clock::now() + std::chrono::seconds(30);
    while (done.load() < target.load() && Clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
}

std::size_t wireSize(const Dictionary& payload)
{
    msgpack::sbuffer buffer;
    encodeRpcRequest(buffer, 1, method::kSendMessage,
                     Array({Value(payload), Value(kReportCategory), Value(kReportType), Value(Array({Value(1)}))}));
    return buffer.size();
}

} // namespace

ClosedLoopFigures driveClosedLoop(const std::filesystem::path& socket, int connections, int inFlight, double seconds,
                                  bool withSessions)
{
    struct Lane {
        std::unique_ptr<mxr::Client> client;
        std::int64_t id;
        std::mt19937 random;
        int seq = 0;
    };
    std::vector<std::unique_ptr<Lane>> lanes;
    for (int c = 0; c < connections; ++c) {
        auto lane = std::make_unique<Lane>(Lane{connectOrExit(socket), c + 1, std::mt19937(c)});
        if (withSessions)
            startBenchSession(*lane->client, lane->id);
        lanes.push_back(std::move(lane));
    }

    std::atomic<bool> running{true};
    std::atomic<std::uint64_t> issued{0}, completed{0}, errors{0};
    std::mutex latencyMutex;
    std::vector<double> latencies;
    latencies.reserve(4'000'000);
    std::function<void(Lane&)> issue = [&](Lane& lane) {
        if (!running)
            return;
        auto payload = payloadOf(benchReport(lane.random, lane.seq++));
        auto sent = Clock::now();
        ++issued;
        lane.client->sendAsync(payload, kReportCategory, kReportType, std::vector<std::int64_t>{lane.id},
                               [&, sent, lanePointer = &lane](int result) {
                                   double micros =
                                       std::chrono::duration<double, std::micro>(Clock::now() - sent).count();
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
        for (int k = 0; k < inFlight; ++k)
            issue(*lane);
    std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
    running = false;
    double elapsed = std::chrono::duration<double>(Clock::now() - began).count();
    std::uint64_t done = completed.load();
    // The requests still in flight come back before the clients go.
    waitFor(completed, issued);

    ClosedLoopFigures figures;
    figures.reportsPerSecond = static_cast<double>(done) / elapsed;
    figures.errors = errors;
    figures.answered = completed;
    std::lock_guard lock(latencyMutex);
    sortInto(figures, latencies);
    return figures;
}

ClosedLoopFigures driveBesideAFlood(const std::filesystem::path& socket, int inFlight, double seconds)
{
    auto flooder = connectOrExit(socket);
    auto bystander = connectOrExit(socket);
    startBenchSession(*flooder, 1);
    startBenchSession(*bystander, 2);
    std::atomic<bool> running{true};
    std::atomic<std::uint64_t> issued{0}, completed{0};
    std::mt19937 random(1);
    int seq = 0;
    std::function<void()> flood = [&] {
        if (!running)
            return;
        ++issued;
        flooder->sendAsync(payloadOf(benchReport(random, seq++)), kReportCategory, kReportType,
                           std::vector<std::int64_t>{1}, [&](int) {
                               ++completed;
                               flood();
                           });
    };
    for (int k = 0; k < inFlight; ++k)
        flood();
    std::vector<double> latencies;
    std::mt19937 own(2);
    auto end = Clock::now() + std::chrono::duration<double>(seconds);
    while (Clock::now() < end) {
        auto sent = Clock::now();
        bystander->send(payloadOf(benchReport(own, 0)), kReportCategory, kReportType, {2});
        latencies.push_back(std::chrono::duration<double, std::micro>(Clock::now() - sent).count());
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    running = false;
    waitFor(completed, issued);
    ClosedLoopFigures figures;
    sortInto(figures, latencies);
    return figures;
}

bool storesIdle(const std::filesystem::path& socket)
{
    mxr::Client client(socket.c_str());
    std::string text;
    if (!client.open() || client.status(text) < 0)
        return false;
    auto status = nlohmann::json::parse(text, nullptr, false);
    if (!status.is_object() || !status.contains("stores"))
        return false;
    for (const auto& [name, store] : status["stores"].items())
        if (store.value("queue_depth", 0) != 0)
            return false;
    return true;
}

void waitUntilStoresIdle(const std::filesystem::path& socket)
{
    while (!storesIdle(socket))
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
}

void measureKeptMemory(const std::filesystem::path& socket, pid_t daemon, int reports)
{
    auto client = connectOrExit(socket);
    startBenchSession(*client, 100);
    waitUntilStoresIdle(socket);
    // What earlier loads freed goes back first: the allocator's decay time, twice over.
    std::this_thread::sleep_for(std::chrono::seconds(15));
    long before = memoryKiB(daemon, "VmRSS");

    std::mt19937 random(7);
    std::size_t wireBytes = 0;
    std::atomic<std::uint64_t> answered{0}, sent{0};
    for (int seq = 0; seq < reports; ++seq) {
        auto payload = benchReport(random, seq);
        wireBytes += wireSize(payload);
        // Counted before it goes: its reply may come before the next line runs.
        ++sent;
        client->sendAsync(payloadOf(payload), kReportCategory, kReportType, std::vector<std::int64_t>{100},
                          [&](int) { ++answered; });
        while (sent.load() - answered.load() > 256)
            std::this_thread::yield();
    }
    waitFor(answered, sent);
    waitUntilStoresIdle(socket);
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

double measureFullStop(const std::filesystem::path& socket, int& kept)
{
    auto client = connectOrExit(socket);
    startBenchSession(*client, 200);
    // A million one-byte numbers a report, under the request size: the most values the
    // kept bytes can hold, and so the longest summary.
    std::string samples = "[";
    for (int i = 0; i < 1'000'000; ++i)
        samples += std::to_string(i % 100) + ",";
    samples.back() = ']';
    mxr::Payload payload;
    payload.addJson("samples", samples.c_str());
    for (kept = 0; client->send(payload, kReportCategory, kReportType, {200}) == 0; ++kept)
        ;
    auto begun = Clock::now();
    client->stopSession(200);
    return std::chrono::duration<double>(Clock::now() - begun).count();
}

} // namespace mx::bench
