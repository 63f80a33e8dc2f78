// What an answered report survives, against the real daemon in a private root: a
// reply that says a report was taken means it reaches its stores, whatever the daemon
// meets after (a storm of starts, a kill, a full pending file, files others touched).

#include <atomic>
#include <mutex>
#include <set>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "integration/IntegrationHelpers.h"

namespace mx::testing {
namespace {

std::int64_t count(const DaemonProcess& daemon, const std::string& store, const std::string& sql)
{
    auto rows = daemon.query(store, sql);
    return rows.empty() || rows[0].empty() ? 0 : std::stoll(rows[0][0]);
}

RawRequest report(std::int64_t reporterID, std::int64_t number)
{
    return {"sendMessage:withCategory:andType:forReportingIDs:reply:",
            Array{Dictionary{{"n", number}}, 3, 1, Array{reporterID}}};
}

// Sixteen thousand sessions started at once, one report each: the spool answers every
// discovery at once, so no session loses its backend messages.
TEST(DaemonDurabilityTest, AStormOfStartsKeepsEveryBackendMessage)
{
    DaemonProcess daemon;
    daemon.start();
    constexpr std::int64_t kConnections = 16;
    constexpr std::int64_t kSessions = 1024;
    std::atomic<std::int64_t> answered{0};
    std::vector<std::thread> clients;
    for (std::int64_t c = 0; c < kConnections; ++c)
        clients.emplace_back([&, c] {
            RawConnection connection(daemon.socketPath());
            std::vector<RawRequest> requests;
            for (std::int64_t id = c * kSessions + 1; id <= (c + 1) * kSessions; ++id) {
                requests.push_back({"createReportingSession:reply:", Array{id}});
                requests.push_back({"startReportingSessionForID:reply:", Array{id}});
                requests.push_back(report(id, id));
            }
            // The starts' replies are held until their stops.
            auto responses = exchange(connection, requests, 2 * kSessions);
            for (std::size_t i = 2; i < responses.size(); i += 3)
                answered += responses[i].error.isNil() && responses[i].result.isNil() ? 1 : 0;
        });
    for (auto& client : clients)
        client.join();
    EXPECT_EQ(answered, kConnections * kSessions) << "every report, answered nil";
    daemon.signal(SIGTERM);
    ASSERT_EQ(daemon.waitForExit(), 0);
    EXPECT_EQ(count(daemon, "uplink", "SELECT count(*) FROM messages WHERE session IS NOT NULL AND type = 1"),
              kConnections * kSessions);
    EXPECT_THAT(daemon.log(), ::testing::Not(::testing::HasSubstr("failed to find backend")));
}

// Reports answered right after a start, while its configuration has not run: they are
// kept before their replies, and a killService right after loses none.
TEST(DaemonDurabilityTest, ReportsAnsweredBeforeTheirSessionsConfigurationRanSurviveAKillService)
{
    DaemonProcess daemon;
    daemon.start();
    RawConnection connection(daemon.socketPath());
    std::vector<RawRequest> requests{{"createReportingSession:reply:", Array{7}},
                                     {"startReportingSessionForID:reply:", Array{7}}};
    for (std::int64_t n = 0; n < 300; ++n)
        requests.push_back(report(7, n));
    auto responses = exchange(connection, requests, 301);
    ASSERT_EQ(responses.back().result, Value());
    ASSERT_TRUE(connection.send(packed([](auto& p) {
        p.pack_array(4), p.pack(0), p.pack(999), p.pack(std::string("killService:")), p.pack_array(0);
    })));
    ASSERT_EQ(daemon.waitForExit(), 2);
    daemon.start();
    EXPECT_EQ(count(daemon, "tally", "SELECT count(*) FROM events WHERE name LIKE '%Playback.Start'"), 300);
    EXPECT_EQ(count(daemon, "uplink", "SELECT count(*) FROM messages WHERE session IS NOT NULL"), 300);
}

// Reports too large for what a store keeps pending wait for their commit before they
// are answered: a SIGKILL amid them loses none that was answered.
TEST(DaemonDurabilityTest, ReportsThatFindNoRoomAmongThePendingRowsAreAnsweredOnlyOnceCommitted)
{
    DaemonProcess daemon;
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(3), 0);
    client->startSession(3);
    std::mutex mutex;
    std::set<std::int64_t> answered;
    std::string filler(24 << 10, 'f');
    for (std::int64_t n = 0; n < 400; ++n)
        sendAsyncPaced(*client, payloadOf(Dictionary{{"n", n}, {"filler", filler}}), 3, 1, std::vector<std::int64_t>{3},
                       [&, n](int result) {
                           std::lock_guard lock(mutex);
                           if (result == 0)
                               answered.insert(n);
                       });
    ASSERT_TRUE(waitUntil([&] {
        std::lock_guard lock(mutex);
        return answered.size() > 100;
    }));
    daemon.signal(SIGKILL);
    ASSERT_EQ(daemon.waitForExit(), 128 + SIGKILL);
    client.reset();
    daemon.start();
    std::set<std::int64_t> inTally;
    for (const auto& row : daemon.query("tally", "SELECT json_extract(payload, '$.n') FROM events"))
        inTally.insert(std::stoll(row[0]));
    std::set<std::int64_t> inSpool;
    for (const auto& row : daemon.query("uplink", "SELECT json_extract(payload, '$.n') FROM messages"))
        inSpool.insert(std::stoll(row[0]));
    std::lock_guard lock(mutex);
    for (auto n : answered) {
        EXPECT_TRUE(inTally.contains(n)) << "answered report " << n << " lost from tally.db";
        EXPECT_TRUE(inSpool.contains(n)) << "answered report " << n << " lost from uplink.db";
    }
}

// A disk too full to make the stores at start-up keeps no daemon from serving: it
// answers from memory, says so, and writes in once there is room.
TEST(DaemonDurabilityTest, ADaemonStartsAndServesOnADiskTooFullForItsStores)
{
    DaemonProcess daemon;
    Tmpfs stores(daemon.path("var/lib/harmonia"), "size=512k");
    if (!stores.mounted())
        GTEST_SKIP() << "cannot mount a tmpfs here (not root?)";
    daemon.start();
    EXPECT_THAT(daemon.log(), ::testing::HasSubstr("serving all the same"));
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(3), 0);
    for (int i = 0; i < 20; ++i)
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"n", i}}), 3, 1, {3}), 0) << "report " << i;
    ASSERT_TRUE(stores.remount("size=64m"));
    EXPECT_TRUE(waitUntil([&] { return count(daemon, "tally", "SELECT count(*) FROM events") == 20; }));
    EXPECT_TRUE(waitUntil([&] { return count(daemon, "uplink", "SELECT count(*) FROM messages") == 20; }));
}

// Stopped while its stores cannot write, a daemon ends within its bound all the same:
// what it could not commit stays in its pending rows, and the next start writes it in.
TEST(DaemonDurabilityTest, AStopEndsWithinTenSecondsWhateverTheStoresDo)
{
    DaemonProcess daemon;
    Tmpfs stores(daemon.path("var/lib/harmonia"), "size=1m");
    if (!stores.mounted())
        GTEST_SKIP() << "cannot mount a tmpfs here (not root?)";
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(3), 0);
    client->startSession(3);
    std::atomic<int> answered{0};
    auto report = payloadOf(Dictionary{{"filler", std::string(100, 'f')}});
    for (int i = 0; i < 30000; ++i)
        if (sendAsyncPaced(*client, report, 3, 1, std::vector<std::int64_t>{3},
                           [&](int result) { answered += result == 0; }) == -EAGAIN)
            break; // held: the library takes no more
    ASSERT_TRUE(daemon.waitForLog("cannot write", std::chrono::seconds(60)));
    auto began = std::chrono::steady_clock::now();
    daemon.signal(SIGTERM);
    ASSERT_EQ(daemon.waitForExit(), 0);
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(15));
    EXPECT_TRUE(daemon.waitForLog("stay in the pending rows for the next start"));
    client.reset();

    ASSERT_TRUE(stores.remount("size=256m"));
    daemon.start();
    EXPECT_GE(count(daemon, "tally", "SELECT count(*) FROM events"), answered.load());
    EXPECT_GE(count(daemon, "uplink", "SELECT count(*) FROM messages"), answered.load());
}

} // namespace
} // namespace mx::testing
