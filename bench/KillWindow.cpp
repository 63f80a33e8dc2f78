#include "KillWindow.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <random>
#include <sqlite3.h>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <fmt/format.h>

#include "BenchReport.h"
#include "RawRpc.h"
#include "Servers.h"
#include "wire/MsgpackRpcMessage.h"
#include "wire/MxReportingMethods.h"

namespace mx::bench {

namespace {

using Clock = std::chrono::steady_clock;

// Enough for two seconds at the highest rate the benchmark offers.
constexpr std::size_t kMostReports = 100'000;

double epochSeconds()
{
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::int64_t countRows(const std::filesystem::path& store, const std::string& sql)
{
    sqlite3* database = nullptr;
    std::int64_t count = -1;
    if (sqlite3_open_v2(store.c_str(), &database, SQLITE_OPEN_READWRITE, nullptr) == SQLITE_OK) {
        sqlite3_stmt* statement = nullptr;
        if (sqlite3_prepare_v2(database, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK &&
            sqlite3_step(statement) == SQLITE_ROW)
            count = sqlite3_column_int64(statement, 0);
        sqlite3_finalize(statement);
    }
    sqlite3_close(database);
    return count;
}

// One daemon's life: reports at `rate` from report number `base` on, then the kill.
struct Round {
    std::vector<Clock::time_point> acknowledgedAt = std::vector<Clock::time_point>(kMostReports);
    std::atomic<std::size_t> acknowledged{0};
    std::atomic<bool> sending{true};
    Clock::time_point killedAt;
};

void sendReports(int fd, double rate, int base, std::int64_t reporterID, Round& round)
{
    std::mt19937 random(static_cast<unsigned>(base));
    auto period = std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(1.0 / rate));
    auto due = Clock::now();
    msgpack::sbuffer request;
    for (std::uint32_t i = 0; i < kMostReports && round.sending.load(); ++i, due += period) {
        request.clear();
        encodeRpcRequest(request, i, method::kSendMessage,
                         Array{Value(benchReport(random, base + static_cast<int>(i))), Value(kReportCategory),
                               Value(kReportType), Value(Array{Value(reporterID)})});
        std::this_thread::sleep_until(due);
        if (::send(fd, request.data(), request.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(request.size()))
            return;
    }
}

// Replies come in the order of their reports: one client, one session.
void readReplies(int fd, Round& round)
{
    readResponses(fd, [&](const RpcResponse& response, Clock::time_point now) {
        if (!response.error.isNil() || response.msgid != round.acknowledged.load())
            return false;
        round.acknowledgedAt[response.msgid] = now;
        ++round.acknowledged;
        return true;
    });
}

} // namespace

KillWindowFigures measureKillWindow(const std::filesystem::path& root, double rate, int rounds)
{
    KillWindowFigures figures;
    std::mt19937 random(42);
    double windowsSum = 0;
    for (int number = 0; number < rounds; ++number) {
        pid_t daemon = spawnDaemon(root);
        if (!waitForSocket(daemonSocket(root)))
            throw std::runtime_error("kill window: the daemon did not come up");
        double began = epochSeconds();
        int base = number * static_cast<int>(kMostReports);
        std::int64_t reporterID = 500 + number;
        auto owner = std::make_unique<mxr::Client>(daemonSocket(root).c_str());
        owner->open();
        startBenchSession(*owner, reporterID);
        int fd = connectRaw(daemonSocket(root));
        Round round;
        std::thread reader([&] { readReplies(fd, round); });
        std::thread sender([&] { sendReports(fd, rate, base, reporterID, round); });
        std::this_thread::sleep_for(std::chrono::milliseconds(1000 + random() % 1000));
        ::kill(daemon, SIGKILL);
        round.killedAt = Clock::now();
        waitpid(daemon, nullptr, 0);
        owner.reset(); // before it finds the next round's daemon
        round.sending = false;
        ::shutdown(fd, SHUT_RDWR);
        sender.join();
        reader.join();
        ::close(fd);

        std::size_t acknowledged = round.acknowledged.load();
        // What the next start writes in from the rows it finds pending counts as kept.
        pid_t restarted = spawnDaemon(root);
        if (!waitForSocket(daemonSocket(root)))
            throw std::runtime_error("kill window: the daemon did not come up again");
        endProcess(restarted, SIGTERM);
        std::string bySeq = fmt::format("json_extract(payload, '$.seq') BETWEEN {} AND {}", base,
                                        base + static_cast<int>(kMostReports) - 1);
        auto stores = root / "var/lib/harmonia";
        double longest = 0;
        std::size_t lost = 0;
        for (std::int64_t kept :
             {countRows(stores / "tally.db", "SELECT count(*) FROM events WHERE " + bySeq),
              countRows(stores / "uplink.db", "SELECT count(*) FROM messages WHERE " + bySeq),
              countRows(stores / "joule.db", fmt::format("SELECT count(*) FROM events WHERE time >= {}", began))}) {
            auto keptCount = static_cast<std::size_t>(std::max<std::int64_t>(kept, 0));
            if (keptCount >= acknowledged)
                continue;
            lost = std::max(lost, acknowledged - keptCount);
            longest = std::max(
                longest,
                std::chrono::duration<double, std::milli>(round.killedAt - round.acknowledgedAt[keptCount]).count());
        }
        ++figures.rounds;
        figures.acknowledged += acknowledged;
        figures.lost += lost;
        figures.longestWindowMilliseconds = std::max(figures.longestWindowMilliseconds, longest);
        windowsSum += longest;
    }
    figures.meanWindowMilliseconds = rounds > 0 ? windowsSum / rounds : 0;
    return figures;
}

} // namespace mx::bench
