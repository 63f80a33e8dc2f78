#include "OpenLoop.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "BenchReport.h"
#include "ProcessCounters.h"
#include "RawRpc.h"
#include "wire/MsgpackRpcMessage.h"
#include "wire/MxReportingMethods.h"

namespace mx::bench {

namespace {

using Clock = std::chrono::steady_clock;

// Request ids of the reports start here; anything below is not a report's reply.
constexpr std::uint32_t kFirstReportID = 1000;

// Creates, configures and starts the session of `reporterID` on the connection, as a
// component does before its first report. The start is answered when the session
// stops; the reports queue behind it.
void startSession(int fd, std::int64_t reporterID)
{
    const std::pair<std::string_view, Array> requests[] = {
        {method::kCreateReportingSession, Array{Value(reporterID)}},
        {method::kSetServiceType, Array{Value(7), Value(reporterID)}},
        {method::kSetConfiguration, Array{Value(Dictionary{{"HostApplicationDisplayID", "bench"}}), Value(reporterID)}},
    };
    msgpack::sbuffer buffer;
    std::uint32_t msgid = 0;
    for (const auto& [name, arguments] : requests)
        encodeRpcRequest(buffer, ++msgid, name, arguments);
    encodeRpcRequest(buffer, msgid + 1, method::kStartReportingSessionForID, Array{Value(reporterID)});
    if (!sendAll(fd, buffer.data(), buffer.size()))
        throw std::runtime_error("open loop: the session's requests were not taken");
    std::uint32_t answered = 0;
    if (!readResponses(fd, [&](const RpcResponse&, Clock::time_point) { return ++answered < msgid; }))
        throw std::runtime_error("open loop: the connection ended before the session started");
}

// The replies: each report's latency from when it was due, filled in by msgid.
struct Replies {
    explicit Replies(std::size_t count) : due(count), latencyMicroseconds(count, -1) {}
    std::vector<Clock::time_point> due;
    std::vector<double> latencyMicroseconds;
    std::atomic<std::uint64_t> answered{0};
    std::atomic<std::uint64_t> errors{0};
    std::atomic<Clock::rep> lastReply{0};
};

void readReplies(int fd, Replies& replies)
{
    readResponses(fd, [&](const RpcResponse& response, Clock::time_point now) {
        if (response.msgid < kFirstReportID || response.msgid - kFirstReportID >= replies.due.size())
            return true;
        std::size_t index = response.msgid - kFirstReportID;
        replies.latencyMicroseconds[index] =
            std::chrono::duration<double, std::micro>(now - replies.due[index]).count();
        if (!response.error.isNil())
            ++replies.errors;
        replies.lastReply.store(now.time_since_epoch().count());
        return ++replies.answered < replies.due.size();
    });
}

double percentile(const std::vector<double>& sorted, double fraction)
{
    if (sorted.empty())
        return 0;
    auto index = static_cast<std::size_t>(fraction * static_cast<double>(sorted.size()));
    return sorted[std::min(sorted.size() - 1, index)];
}

} // namespace

OpenLoopFigures runOpenLoop(const std::filesystem::path& socket, pid_t server, double rate, double seconds,
                            std::int64_t reporterID)
{
    auto count = static_cast<std::size_t>(rate * seconds);
    auto period = std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(1.0 / rate));
    int fd = connectRaw(socket);
    if (fd < 0)
        throw std::runtime_error("open loop: cannot connect to " + socket.string());
    if (reporterID != 0)
        startSession(fd, reporterID);
    Replies replies(count);
    std::thread reader([&] { readReplies(fd, replies); });
    std::mt19937 random(static_cast<unsigned>(reporterID));
    Array ids;
    if (reporterID != 0)
        ids.append(Value(reporterID));

    auto before = ProcessCounters::of(server);
    auto start = Clock::now() + std::chrono::milliseconds(10);
    msgpack::sbuffer request;
    for (std::size_t i = 0; i < count; ++i) {
        replies.due[i] = start + period * static_cast<Clock::rep>(i);
        request.clear();
        encodeRpcRequest(request, static_cast<std::uint32_t>(kFirstReportID + i), method::kSendMessage,
                         Array{Value(benchReport(random, static_cast<int>(i))), Value(kReportCategory),
                               Value(kReportType), Value(ids)});
        std::this_thread::sleep_until(replies.due[i]);
        if (!sendAll(fd, request.data(), request.size()))
            break;
    }
    auto deadline = Clock::now() + std::chrono::seconds(30);
    while (replies.answered.load() < count && Clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    // What the server does after its last reply, for a second, is the reports' too.
    Clock::time_point lastReply{Clock::duration(replies.lastReply.load())};
    std::this_thread::sleep_until(std::max(lastReply, start) + std::chrono::seconds(1));
    auto spent = ProcessCounters::of(server) - before;
    ::shutdown(fd, SHUT_RDWR);
    reader.join();
    ::close(fd);

    OpenLoopFigures figures;
    figures.sent = count;
    figures.answered = replies.answered.load();
    figures.errors = replies.errors.load() + (count - figures.answered);
    std::vector<double> latencies;
    latencies.reserve(count);
    for (double latency : replies.latencyMicroseconds)
        if (latency >= 0)
            latencies.push_back(latency);
    std::sort(latencies.begin(), latencies.end());
    figures.p50Microseconds = percentile(latencies, 0.5);
    figures.p99Microseconds = percentile(latencies, 0.99);
    figures.maxMicroseconds = latencies.empty() ? 0 : latencies.back();
    figures.cpuMicrosecondsPerReport = spent.cpuSeconds * 1e6 / static_cast<double>(count);
    figures.switchesPerReport = static_cast<double>(spent.switches) / static_cast<double>(count);
    for (const auto& [name, thread] : spent.byThreadName)
        if (thread.switches > 0)
            figures.perReportByThreadName[name] = {thread.cpuSeconds * 1e6 / static_cast<double>(count),
                                                   static_cast<double>(thread.switches) / static_cast<double>(count)};
    return figures;
}

} // namespace mx::bench
