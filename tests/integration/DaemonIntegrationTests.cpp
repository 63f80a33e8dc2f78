// The daemon as clients meet it: a real process, real sockets, real stores, in a
// private root per test.

#include <csignal>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <thread>

#include <fmt/format.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <msgpack.hpp>
#include <nlohmann/json.hpp>

#include "integration/DaemonProcess.h"
#include "integration/IntegrationHelpers.h"
#include "wire/Datagram.h"

namespace mx::testing {
namespace {

class DaemonIntegrationTest : public ::testing::Test {
protected:
    void SetUp() override { daemon.start(); }
    std::unique_ptr<mxr::Client> connect() { return connectTo(daemon); }

    DaemonProcess daemon;
};

TEST_F(DaemonIntegrationTest, BadInputClosesOnlyThatConnection)
{
    auto bystander = connect();
    ASSERT_EQ(bystander->createSession(7), 0);

    struct Case {
        std::string bytes;
        std::string reason;
    };
    std::string deep;
    for (int i = 0; i < 70; ++i)
        deep += '\x91'; // fixarray of one
    deep += '\xc0';
    // The decoder's tests cover every reason; these are the ones a connection meets
    // at different points of its read.
    std::vector<Case> cases = {
        {"\xc1", "malformed MessagePack"},
        {deep, "nesting deeper than 64"},
        {std::string("\xdb\x00\x20\x00\x00", 5) + std::string((1 << 20) + 4096, 'x'), "message larger than 1 MiB"},
        // Containers declaring billions of elements, nested: refused at the first header.
        {std::string("\x94\xdd\xff\xff\xff\xff\xdd\xff\xff\xff\xff", 11), "message larger than 1 MiB"},
        {packed([](auto& p) { p.pack_array(2), p.pack(0), p.pack(1); }), "not a msgpack-rpc request"},
    };
    for (const auto& badInput : cases) {
        RawConnection raw(daemon.socketPath());
        ASSERT_TRUE(raw.connected());
        raw.send(badInput.bytes); // the daemon may close before it has read everything
        EXPECT_TRUE(raw.waitForClose()) << badInput.reason;
        EXPECT_TRUE(daemon.waitForLog("pid " + std::to_string(getpid()) + ": " + badInput.reason)) << badInput.reason;
    }
    EXPECT_EQ(bystander->setServiceType(7, 7), 0) << "the bystander is still served";
    EXPECT_EQ(bystander->serviceType(7), 7);
}

TEST_F(DaemonIntegrationTest, AClientThatPipelinesAndNeverReadsIsHeldAtItsBoundAndHoldsUpNobody)
{
    RawConnection flooder(daemon.socketPath());
    ASSERT_TRUE(flooder.connected());
    fcntl(flooder.fd(), F_SETFL, O_NONBLOCK);
    // Requests that queue on the server, and now and then one whose error reply
    // echoes a long method name, so that unread replies pile up quickly too.
    std::string burst;
    for (int i = 0; i < 1000; ++i) {
        burst += packed([&](auto& p) {
            p.pack_array(4), p.pack(0), p.pack(i),
                p.pack(std::string("sendMessage:withCategory:andType:forReportingIDs:reply:"));
            p.pack_array(4), p.pack_map(1), p.pack(std::string("level")), p.pack(std::string(200, 'x')), p.pack(3);
            p.pack(1), p.pack_array(0);
        });
        if (i % 20 == 0)
            burst += packed([](auto& p) {
                p.pack_array(4), p.pack(0), p.pack(1), p.pack(std::string(1000, 'm')), p.pack_array(0);
            });
    }
    // Write until the daemon stops reading.
    std::size_t written = 0;
    bool blocked = waitUntil([&] {
        std::size_t offset = written % burst.size();
        ssize_t sent = ::send(flooder.fd(), burst.data() + offset, burst.size() - offset, MSG_NOSIGNAL);
        if (sent > 0)
            written += std::size_t(sent);
        return sent < 0 && errno == EAGAIN;
    });
    ASSERT_TRUE(blocked) << "the daemon kept reading after " << written << " bytes";
    EXPECT_LT(daemon.residentBytes(), kMemoryBound) << "holding " << written << " bytes of requests";

    auto client = connect();
    auto began = std::chrono::steady_clock::now();
    ASSERT_EQ(client->createSession(9), 0);
    EXPECT_EQ(validity(*client, 9), (Dictionary{{"reporterID", 9}, {"serviceType", 65535}}));
    // Not a speed check: before the bounds, a round trip waited out the whole flood.
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(1));

    // A held client is read no more, but its leaving is still noticed.
    flooder.close();
    EXPECT_TRUE(daemon.waitForLog(fmt::format("removing {} from the server client list", getpid())));
}

TEST_F(DaemonIntegrationTest, AKilledClientsSessionsStopAndItsUptimeIsReported)
{
    auto bystander = connect();
    pid_t victim =
        daemon.spawn({MXREPORT_PATH, "create", "11", "--", "type", "11", "test", "--", "start", "11", "--wait"});
    ASSERT_TRUE(daemon.waitForLog("session created for reporter 11"));
    ASSERT_TRUE(waitUntil([&] {
        return validity(*bystander, 11) == Dictionary{{"reporterID", 11}, {"serviceType", 11}};
    }));
    ::kill(victim, SIGKILL);
    waitpid(victim, nullptr, 0);

    EXPECT_TRUE(daemon.waitForLog(fmt::format("removing {} from the server client list", victim)));
    EXPECT_TRUE(daemon.waitForLog("InvalidationHandler: connection exited process=mxreport"));
    EXPECT_TRUE(waitUntil([&] {
        return !daemon
                    .query("tally",
                           "SELECT payload FROM events WHERE name = "
                           "'com.kestrel.harmonia.mxreportingclientuptime'")
                    .empty();
    }));
    auto uptime = nlohmann::json::parse(daemon.query("tally",
                                                     "SELECT payload FROM events WHERE name = "
                                                     "'com.kestrel.harmonia.mxreportingclientuptime'")[0][0]);
    EXPECT_EQ(uptime["processName"], "mxreport");
    EXPECT_TRUE(uptime["seconds"].is_number_float());
    EXPECT_EQ(validity(*bystander, 11), (Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
    EXPECT_EQ(bystander->createSession(12), 0);
}

TEST_F(DaemonIntegrationTest, ReportingSwitchFollowsThePreferencesWhenTheNotificationIsPosted)
{
    auto client = connect();
    auto refused = [&] {
        return client->send(payloadOf(Dictionary{{"a", 1}}), 3, 1, std::nullopt) == -EPERM;
    };
    daemon.writeFile("var/lib/harmonia/preferences/com.kestrel.harmonia.json",
                     R"({"disable_reporting": true, "device_name": "den"})");
    EXPECT_FALSE(refused()) << "nothing changes before the notification";

    pid_t poster = daemon.spawn({MXREPORT_PATH, "notify"});
    waitpid(poster, nullptr, 0);
    EXPECT_TRUE(waitUntil(refused));
    EXPECT_TRUE(daemon.waitForLog("defaults {\"device_name\":\"den\",\"disable_reporting\":1}"));
}

TEST_F(DaemonIntegrationTest, ReportsReachEveryStoreAndSigtermUnderLoadLosesNothingAcknowledged)
{
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    auto client = connect();
    ASSERT_EQ(client->createSession(21), 0);
    ASSERT_EQ(client->setServiceType(21, 7), 0);
    ASSERT_EQ(client->setConfiguration(21, payloadOf(Dictionary{{"HostApplicationDisplayID", "ExampleHost"}})), 0);
    client->startSession(21);
    for (int i = 0; i < 50; ++i)
        ASSERT_EQ(
            client->send(payloadOf(Dictionary{{"seq", i}, {"EngineOnTime", 0.5}, {"mxreporting_timestamp", 100 + i}}),
                         0x08000003, 1, {21}),
            0);
    ASSERT_EQ(client->stopSession(21), 0);
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"alone", true}}), 1, 0, std::nullopt), 0);
    ASSERT_EQ(client->createSession(4), 0);
    ASSERT_EQ(client->setServiceType(4, 10), 0); // alarms: sent alone, up to 59 s later
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"alarm", 1}}), 3, 1, {4}), 0);

    // Then pipelined load on a started session, and SIGTERM in the middle of it.
    ASSERT_EQ(client->createSession(3), 0);
    client->startSession(3);
    std::atomic<int> acknowledged{0};
    std::atomic<bool> sending{true};
    std::thread load([&] {
        for (int i = 0; sending; ++i) {
            sendAsyncPaced(*client, payloadOf(Dictionary{{"seq", i}}), 3, 2, std::vector<std::int64_t>{3},
                           [&](int result) { acknowledged += result == 0 ? 1 : 0; });
            std::vector<std::int64_t> reporters;
            if (i % 64 == 63)
                client->reporters(reporters); // some 64 requests in flight
        }
    });
    EXPECT_TRUE(waitUntil([&] { return acknowledged > 5000; }));
    daemon.signal(SIGTERM);
    EXPECT_EQ(daemon.waitForExit(), 0);
    sending = false;
    load.join();
    EXPECT_TRUE(daemon.waitForLog("everything taken is committed"));
    client.reset();

    auto count = [&](const std::string& store, const std::string& where) {
        return std::stoi(daemon.query(store, "SELECT count(*) FROM " + where)[0][0]);
    };
    EXPECT_EQ(count("tally", "events WHERE name = 'com.kestrel.harmonia.Session_Playback.Start'"), 50);
    EXPECT_EQ(count("joule", "events WHERE name = 'Tessera_Haptics' AND agent = 28"), 50);
    EXPECT_GE(count("tally", "events WHERE name = 'com.kestrel.harmonia.Playback.Stop'"), acknowledged.load());
    EXPECT_GE(count("uplink", "messages WHERE type = 2"), acknowledged.load());
    EXPECT_EQ(count("uplink", "messages WHERE session IS NULL AND payload LIKE '%alarm%'"), 1)
        << "the delayed single message went out at shutdown";
    auto sessions = daemon.query("uplink", "SELECT id, session_info, user_info FROM sessions ORDER BY id");
    ASSERT_GE(sessions.size(), 1u);
    auto sessionInfo = nlohmann::json::parse(sessions[0][1]);
    EXPECT_EQ(sessionInfo.size(), 6u);
    EXPECT_EQ(sessionInfo["SessionID"], 21);
    EXPECT_EQ(nlohmann::json::parse(sessions[0][2])["ServiceName"], "longformaudio_session");
    auto messages = daemon.query(
        "uplink", "SELECT category, type, payload FROM messages WHERE session = " + sessions[0][0] + " ORDER BY id");
    ASSERT_EQ(messages.size(), 51u);
    for (int i = 0; i < 50; ++i)
        EXPECT_EQ(nlohmann::json::parse(messages[i][2])["seq"], i);
    EXPECT_EQ(messages[50][1], "65535") << "the summary event comes last";
    auto summary = std::filesystem::directory_iterator(daemon.path("var/log/harmonia/reporting"))->path();
    EXPECT_THAT(summary.filename().string(), ::testing::EndsWith("-harmonia-ExampleHost-longformaudio.json"));
    auto alone =
        daemon.query("uplink", "SELECT user_info FROM messages WHERE session IS NULL AND payload LIKE '%alone%'");
    ASSERT_EQ(alone.size(), 1u);
    EXPECT_EQ(nlohmann::json::parse(alone[0][0])["ServiceName"], "standalone");
}

TEST_F(DaemonIntegrationTest, ASecondDaemonOnTheSameRootLeavesTheFirstAlone)
{
    std::string text;
    EXPECT_EQ(daemon.runToEnd({MXREPORTINGD_PATH}, text), 1);
    EXPECT_THAT(
        text, ::testing::HasSubstr(fmt::format("another mxreportingd (pid {}) is running on this root", daemon.pid())));
    EXPECT_EQ(connect()->createSession(1), 0) << "the first one still serves its socket";
}

TEST(DaemonStoreFailureTest, AFullDiskHoldsReportsUntilThereIsRoomAndLosesNone)
{
    DaemonProcess daemon;
    Tmpfs stores(daemon.path("var/lib/harmonia"), "size=1m");
    if (!stores.mounted())
        GTEST_SKIP() << "cannot mount a tmpfs here (not root?)";
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    ASSERT_EQ(client->createSession(3), 0);
    client->startSession(3);
    // More than the client may owe: it ends up waiting for room.
    constexpr int kReports = 80000;
    std::atomic<int> acknowledged{0};
    auto report = payloadOf(Dictionary{{"filler", std::string(100, 'f')}});
    for (int i = 0; i < kReports; ++i)
        if (sendAsyncPaced(*client, report, 3, 1, std::vector<std::int64_t>{3}, [&](int result) {
                if (result == 0)
                    ++acknowledged;
            }) == -EAGAIN)
            break; // held: the library takes no more
    ASSERT_TRUE(daemon.waitForLog("the clients that sent them wait until it can write again"));

    // The client whose reports wait is answered no more once the rows it sent fill
    // what the stores keep; the others are served on: their requests, and their
    // reports, kept and answered at once.
    auto bystander = connectTo(daemon);
    ASSERT_EQ(bystander->createSession(8), 0);
    for (int i = 0; i < 20; ++i)
        ASSERT_EQ(bystander->send(payloadOf(Dictionary{{"bystander", i}}), 3, 1, {8}), 0) << "report " << i;

    // Shutting down starts while the stores cannot write.
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitForLog("taking no more requests"));
    EXPECT_LT(acknowledged, kReports) << "clients wait while the stores cannot write";
    ASSERT_TRUE(stores.remount("size=256m"));
    ASSERT_EQ(daemon.waitForExit(), 0);
    EXPECT_TRUE(daemon.waitForLog("writing again after"));
    auto count = [&](const char* store, const char* table) {
        return std::stoi(daemon.query(store, std::string("SELECT count(*) FROM ") + table)[0][0]);
    };
    EXPECT_GE(count("tally", "events"), acknowledged.load() + 20);
    EXPECT_GE(count("uplink", "messages"), acknowledged.load() + 20);
    auto log = daemon.log();
    std::size_t failures = 0;
    for (auto at = log.find("cannot write"); at != std::string::npos; at = log.find("cannot write", at + 1))
        ++failures;
    EXPECT_LE(failures, 3u) << "one line per store when failing starts, not one per row";
    client.reset();
}

// Stores that cannot be written at start-up keep no daemon from serving: it says so,
// with what to mend, holds what it is sent, and writes it once the disk takes it.
TEST(DaemonStoreFailureTest, StoresThatCannotBeWrittenAtStartUpServeAndWriteOnceTheyCan)
{
    DaemonProcess daemon;
    Tmpfs stores(daemon.path("var/lib/harmonia"), "size=1m,ro");
    if (!stores.mounted())
        GTEST_SKIP() << "cannot mount a tmpfs here (not root?)";
    daemon.start();
    // What to mend: the file, its directory's owner and mode, and whom the daemon runs as.
    EXPECT_THAT(daemon.log(),
                ::testing::ContainsRegex(daemon.path("var/lib/harmonia/tally.db").string() +
                                         ": cannot make it: Read-only file system \\(" +
                                         daemon.path("var/lib/harmonia").string() +
                                         " is owned by [^ ]+:[^ ]+, mode [0-7]+; this process runs as"));
    EXPECT_THAT(daemon.log(), ::testing::HasSubstr("kept in memory alone"));
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(3), 0);
    for (int i = 0; i < 10; ++i)
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"n", i}}), 3, 1, {3}), 0);
    std::string status;
    ASSERT_EQ(client->status(status), 0);
    EXPECT_EQ(nlohmann::json::parse(status)["stores"]["tally"]["pending_rows_in_memory"], true);

    ASSERT_TRUE(stores.remount("rw"));
    EXPECT_TRUE(waitUntil([&] {
        auto rows = daemon.query("tally", "SELECT count(*) FROM events");
        return !rows.empty() && rows[0][0] == "10";
    }));
}

TEST(DaemonStoreFailureTest, CorruptStoresAreSetAsideAndARemovedOneIsMadeAnew)
{
    DaemonProcess daemon;
    daemon.writeFile("var/lib/harmonia/joule.db", std::string(8192, 'J'));
    daemon.start();
    EXPECT_TRUE(daemon.waitForLog("joule.db is corrupt"));
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    ASSERT_EQ(client->createSession(3), 0);
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"EngineOnTime", 1}}), 3, 1, {3}), 0);
    EXPECT_TRUE(waitUntil([&] { return daemon.query("joule", "SELECT count(*) FROM events")[0][0] == "1"; }));
    // Committed before the directory goes, or the new store would hold it too.
    EXPECT_TRUE(waitUntil([&] { return daemon.query("tally", "SELECT count(*) FROM events")[0][0] == "1"; }));
    bool setAside = false;
    for (const auto& entry : std::filesystem::directory_iterator(daemon.path("var/lib/harmonia")))
        setAside |= entry.path().filename().string().starts_with("joule.db.corrupt-");
    EXPECT_TRUE(setAside);

    std::filesystem::remove_all(daemon.path("var/lib/harmonia"));
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"after", 1}}), 3, 1, {3}), 0);
    EXPECT_TRUE(daemon.waitForLog("tally.db was removed: making a new one"));
    EXPECT_TRUE(waitUntil([&] {
        auto rows = daemon.query("tally", "SELECT count(*) FROM events");
        return !rows.empty() && rows[0][0] == "1";
    }));
}

TEST_F(DaemonIntegrationTest, ASymlinkPlantedForTheSummaryDirectoryIsNotFollowed)
{
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    auto elsewhere = daemon.path("elsewhere");
    std::filesystem::create_directories(elsewhere);
    std::filesystem::create_directories(daemon.path("var/log/harmonia"));
    std::filesystem::create_directory_symlink(elsewhere, daemon.path("var/log/harmonia/reporting"));
    auto client = connect();
    ASSERT_EQ(client->createSession(5), 0);
    client->startSession(5);
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"a", 1}}), 3, 1, {5}), 0);
    ASSERT_EQ(client->stopSession(5), 0);
    EXPECT_TRUE(daemon.waitForLog("var/log/harmonia/reporting is not a directory"));
    EXPECT_TRUE(std::filesystem::is_empty(elsewhere));
}

TEST(DaemonStoreLimitTest, StoresAndSummariesStayWithinTheirLimitsUnexportedRowsCounted)
{
    DaemonProcess daemon;
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    daemon.writeFile(
        "etc/harmonia/stores.json",
        R"({"tally": {"max_bytes": 200000}, "uplink": {"max_bytes": 200000}, "summaries": {"max_files": 2}})");
    // A collector that never answers: nothing in the spool is ever acknowledged.
    daemon.writeFile(
        "etc/harmonia/uplink.json",
        R"({"backends": [{"type": "spool"}, {"type": "otlp-http", "url": "http://127.0.0.1:9/v1/logs"}]})");
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    for (std::int64_t id = 1; id <= 4; ++id) {
        ASSERT_EQ(client->createSession(id), 0);
        ASSERT_EQ(client->setServiceType(id, 11), 0); // test sessions: no backend waits
        ASSERT_EQ(
            client->setConfiguration(id, payloadOf(Dictionary{{"HostApplicationDisplayID", fmt::format("h{}", id)}})),
            0);
        client->startSession(id);
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"a", 1}}), 3, 1, {id}), 0);
        ASSERT_EQ(client->stopSession(id), 0);
    }
    Dictionary report{{"filler", std::string(200, 'f')}};
    for (int i = 0; i < 3000; ++i)
        sendAsyncPaced(*client, payloadOf(report), 1, 0, std::vector<std::int64_t>{4}, nullptr); // to analytics
    for (int i = 0; i < 3000; ++i)
        sendAsyncPaced(*client, payloadOf(report), 1, 0, std::nullopt, nullptr); // alone, to the spool
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"last", 1}}), 1, 0, std::nullopt), 0);
    EXPECT_TRUE(daemon.waitForLog("tally.db: pruned"));
    EXPECT_TRUE(daemon.waitForLog("had not been exported to every collector"));
    daemon.signal(SIGTERM);
    ASSERT_EQ(daemon.waitForExit(), 0);
    auto rows = std::stoi(daemon.query("tally", "SELECT count(*) FROM events")[0][0]);
    EXPECT_GT(rows, 0);
    EXPECT_LT(rows, 2000) << "200 kB hold far fewer than 3000 reports";
    EXPECT_EQ(daemon.query("tally", "SELECT min(id) > 1 AND max(id) >= 3004 FROM events")[0][0], "1")
        << "the oldest went, the newest stayed";
    std::size_t summaries = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator(daemon.path("var/log/harmonia/reporting")))
        ++summaries;
    EXPECT_EQ(summaries, 2u);
}

TEST(DaemonConfigurationTest, ACheckNamesTheBadLineAndAReloadWithErrorsKeepsTheConfigurationInUse)
{
    DaemonProcess daemon;
    daemon.writeFile("etc/harmonia/tally.json", R"({"disabled": ["com.kestrel.harmonia.Session_Playback"]})");
    std::string output;
    EXPECT_EQ(daemon.runToEnd({MXREPORTINGD_PATH, "--check-config"}, output), 0) << output;
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    auto stored = [&](const std::string& name) {
        return daemon.query("tally", "SELECT count(*) FROM events WHERE name = '" + name + "'")[0][0];
    };
    ASSERT_EQ(client->createSession(1), 0);
    ASSERT_EQ(client->setServiceType(1, 11), 0); // a test session: no backend waits
    client->startSession(1);
    // Playback events are disabled; a volume event after each shows it was written.
    auto sendBoth = [&](int round) {
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"round", round}}), 0x08000003, 1, {1}), 0);
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"round", round}}), 11, 0, {1}), 0);
        ASSERT_TRUE(waitUntil([&] { return stored("com.kestrel.harmonia.Volume.Generic") == std::to_string(round); }));
    };
    sendBoth(1);

    daemon.writeFile("etc/harmonia/tally.json", "{\"disabled\": [],\n \"disabld\": 1}");
    EXPECT_EQ(daemon.runToEnd({MXREPORTINGD_PATH, "--check-config"}, output), 1);
    EXPECT_THAT(output,
                ::testing::HasSubstr(daemon.path("etc/harmonia/tally.json").string() +
                                     ":2:2: tally.json has no setting \"disabld\" (it has disabled)"));
    daemon.signal(SIGHUP);
    EXPECT_TRUE(daemon.waitForLog("keeping the configuration in use"));
    sendBoth(2);
    EXPECT_EQ(stored("com.kestrel.harmonia.Session_Playback.Start"), "0");

    daemon.writeFile("etc/harmonia/tally.json", R"({"disabled": []})");
    daemon.signal(SIGHUP);
    EXPECT_TRUE(daemon.waitForLog("configuration read again: 0 collectors, 0 disabled event names"));
    sendBoth(3);
    EXPECT_EQ(stored("com.kestrel.harmonia.Session_Playback.Start"), "1");

    // Whatever stands where the configuration names a file, nothing blocks on it: a FIFO
    // as a CA file is refused at a check and at a reload, at once, and the next good
    // configuration is taken.
    ASSERT_EQ(::mkfifo(daemon.path("etc/harmonia/ca.pem").c_str(), 0644), 0);
    daemon.writeFile("etc/harmonia/uplink.json", R"({"backends": [{"type": "spool"}, {"type": "otlp-http",
        "url": "https://127.0.0.1:9/v1/logs", "tls": {"ca_file": "ca.pem"}}]})");
    EXPECT_EQ(daemon.runToEnd({MXREPORTINGD_PATH, "--check-config"}, output), 1);
    EXPECT_THAT(
        output,
        ::testing::HasSubstr("tls.ca_file: " + daemon.path("etc/harmonia/ca.pem").string() + " is not a regular file"));
    daemon.signal(SIGHUP);
    EXPECT_TRUE(daemon.waitForLog("ca.pem is not a regular file"));
    std::filesystem::remove(daemon.path("etc/harmonia/uplink.json"));
    std::filesystem::create_directory(daemon.path("etc/harmonia/uplink.json"));
    EXPECT_EQ(daemon.runToEnd({MXREPORTINGD_PATH, "--check-config"}, output), 1);
    EXPECT_THAT(output,
                ::testing::HasSubstr(daemon.path("etc/harmonia/uplink.json").string() + " is not a regular file"))
        << "a file there that cannot be read is no absent file";
    std::filesystem::remove(daemon.path("etc/harmonia/uplink.json"));
    daemon.writeFile("etc/harmonia/tally.json", R"({"disabled": ["x"]})");
    daemon.signal(SIGHUP);
    EXPECT_TRUE(daemon.waitForLog("configuration read again: 0 collectors, 1 disabled event names"));
    auto began = std::chrono::steady_clock::now();
    daemon.signal(SIGTERM);
    EXPECT_EQ(daemon.waitForExit(), 0);
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(5));
}

TEST(DaemonOrientationTest, TrackedSessionsRecordEachFedChangeTimedFromTheirOwnStartIntoTheirSummaryEvent)
{
    DaemonProcess daemon;
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    daemon.addEnvironment("reporting_session_verbose=5");
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    auto post = [&](const std::string& datagram) {
        ASSERT_EQ(sendDatagram(daemon.path("run/harmonia/orientation.sock"), datagram), 0u);
    };
    // The feed is read in order: once a bad datagram's line is out, all before it were handled.
    int barrier = 0;
    auto handled = [&] {
        std::string mark = fmt::format("barrier {}", ++barrier);
        post(mark);
        ASSERT_TRUE(daemon.waitForLog(fmt::format("orientation feed: ignored \"{}\"", mark)));
    };
    auto recorded = [&](const std::string& mode, const std::string& text, std::int64_t id) {
        return daemon.waitForLog(fmt::format("mode={} orientation=\"{}\" app=\"(null)\"", mode, text)) &&
            daemon.waitForLog(fmt::format("id=\"MxReportingService {}\"", id));
    };
    // Types 7 and 2 are tracked, 1 is not, and nor is 7 on a device of class 6.
    for (auto [id, type] : {std::pair{1, 7}, {2, 2}, {3, 1}, {4, 7}}) {
        ASSERT_EQ(client->createSession(id), 0);
        ASSERT_EQ(client->setServiceType(id, static_cast<std::uint16_t>(type)), 0);
    }
    auto startAndWait = [&](std::int64_t id) {
        client->startSession(id);
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"rate", 48000}}), 3, 1, {id}), 0);
    };
    post("device 1"); // before any start: nobody hears it
    handled();
    startAndWait(1);
    startAndWait(3);
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true, "DeviceClassNumber": 6})");
    startAndWait(4);
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    post("device 3\n");
    EXPECT_TRUE(recorded("device", "landscape-left", 1));
    post("sideways 3");
    EXPECT_TRUE(daemon.waitForLog(R"(orientation feed: ignored "sideways 3")"));
    startAndWait(2);
    post("ui 4");
    EXPECT_TRUE(recorded("ui", "landscape-right", 2));
    for (std::int64_t id : {1, 2, 3, 4})
        ASSERT_EQ(client->stopSession(id), 0);
    post("device 5"); // between periods
    handled();
    startAndWait(1);
    post("device 6");
    EXPECT_TRUE(recorded("device", "face-down", 1));
    ASSERT_EQ(client->stopSession(1), 0);

    // The stop's reply comes before its backend flush: wait for every summary.
    std::map<std::string, std::vector<nlohmann::json>> byReporter;
    ASSERT_TRUE(waitUntil([&] {
        byReporter.clear();
        for (const auto& row : daemon.query("uplink",
                                            "SELECT json_extract(s.session_info, '$.SessionID'), "
                                            "m.payload FROM messages m JOIN sessions s ON m.session = s.id "
                                            "WHERE m.category = 65535 ORDER BY m.id"))
            byReporter[row[0]].push_back(nlohmann::json::parse(row[1]));
        return byReporter.size() == 4 && byReporter["1"].size() == 2;
    }));
    auto first = byReporter["1"][0];
    EXPECT_EQ(first["device_orientation"], "landscape-left");
    EXPECT_EQ(first["ui_orientation"], "landscape-right");
    EXPECT_EQ(byReporter["1"][1]["device_orientation"], "face-down") << "nothing from before or between periods";
    auto second = byReporter["2"].at(0);
    EXPECT_FALSE(second.contains("device_orientation"));
    EXPECT_LE(std::stod(second["ui_orientation_time"].get<std::string>()),
              std::stod(first["ui_orientation_time"].get<std::string>()))
        << "each session times a change from its own start";
    for (const char* untracked : {"3", "4"})
        EXPECT_FALSE(byReporter[untracked].at(0).contains("ui_orientation")) << "reporter " << untracked;
    for (const auto& file : std::filesystem::directory_iterator(daemon.path("var/log/harmonia/reporting"))) {
        auto entries = nlohmann::json::parse(std::ifstream(file.path()));
        // Element 0 is the user information, the last the summary event.
        for (std::size_t i = 1; i + 1 < entries.size(); ++i)
            EXPECT_FALSE(entries[i].dump().find("orientation") != std::string::npos)
                << "a record is no entry of the file: " << entries[i].dump();
    }
}

TEST(DaemonDriverStatisticsTest, AStopReportsEachDriversGrowthSinceTheStart)
{
    DaemonProcess daemon;
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    auto channel = [&](const std::string& relative, std::int64_t value) {
        daemon.writeFile("run/harmonia/chanstat/" + relative, std::to_string(value) + "\n");
    };
    channel("Speaker/Amp/underruns", 10);
    channel("Speaker/Amp/level", 50);
    channel("Front/MCA/late", 0);
    channel("Haptics/Stats/pulses", 100);
    daemon.start();
    channel("Late/MCA/added", 0);          // a subscription is fixed when made,
    channel("KestrelAE2MCA/overloads", 1); // and a driver missing then is never sampled
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    ASSERT_EQ(client->createSession(6), 0);
    ASSERT_EQ(client->setServiceType(6, 7), 0);
    client->startSession(6);
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"rate", 48000}}), 3, 1, {6}), 0);
    channel("KestrelAE2MCA/overloads", 8);
    channel("Speaker/Amp/underruns", 13);
    channel("Speaker/Amp/level", 20); // down: not reported
    channel("Front/MCA/late", 4);
    channel("Late/MCA/added", 9);
    channel("Haptics/Stats/pulses", 105);
    ASSERT_EQ(client->stopSession(6), 0);
    auto summary = std::filesystem::directory_iterator(daemon.path("var/log/harmonia/reporting"))->path();
    EXPECT_EQ(nlohmann::json::parse(std::ifstream(summary))[2]["DriverStats_Generic_1"]["Haptics_Stats_pulses"], 5);

    // A second period, whose stop finds a channel gone: its driver's sample fails, the
    // others count.
    client->startSession(6);
    std::uint16_t type = 0;
    ASSERT_EQ(client->isValid(6, type), 1) << "the start (and its snapshot) came first";
    channel("Haptics/Stats/pulses", 107);
    std::filesystem::remove(daemon.path("run/harmonia/chanstat/Speaker/Amp/level"));
    channel("Speaker/Amp/underruns", 20);
    ASSERT_EQ(client->stopSession(6), 0);
    EXPECT_TRUE(daemon.waitForLog("ChanstatCreateSamples error 2"));

    // A third, whose start could not sample that driver: its stop reports the driver's
    // absolute values.
    client->startSession(6);
    ASSERT_EQ(client->isValid(6, type), 1);
    channel("Speaker/Amp/level", 30);
    ASSERT_EQ(client->stopSession(6), 0);
    EXPECT_TRUE(daemon.waitForLog("ChanstatCreateSamplesDelta error 2"));

    daemon.signal(SIGTERM);
    ASSERT_EQ(daemon.waitForExit(), 0);
    Dictionary expected{{"Speaker_underruns", 3}, {"MCA_late", 4}, {"Haptics_Stats_pulses", 5}};
    auto event = daemon.query(
        "tally", "SELECT payload FROM events WHERE name = 'com.kestrel.harmonia.DriverStats.Generic' ORDER BY id");
    ASSERT_EQ(event.size(), 3u);
    EXPECT_EQ(nlohmann::json::parse(event[1][0]).dump(),
              R"({"Haptics_Stats_pulses":2,"HostApplicationDisplayID":"Unknown"})");
    EXPECT_EQ(nlohmann::json::parse(event[2][0]).dump(),
              R"({"HostApplicationDisplayID":"Unknown","Speaker_level":30,"Speaker_underruns":20})");
    auto payload = nlohmann::json::parse(event[0][0]);
    EXPECT_EQ(payload.size(), 4u) << payload.dump() << ": the statistics and the host";
    for (const auto& [key, value] : expected)
        EXPECT_EQ(payload[key], value.int64Value()) << key;
    auto messages =
        daemon.query("uplink", "SELECT category, type, payload FROM messages WHERE session = 1 ORDER BY id");
    ASSERT_EQ(messages.size(), 3u);
    EXPECT_EQ(messages[1][0], "9") << "the statistics come before the summary";
    EXPECT_EQ(messages[2][1], "65535");
    EXPECT_EQ(nlohmann::json::parse(messages[2][2])["Speaker_underruns"], "3");
}

TEST_F(DaemonIntegrationTest, AStreamThroughTheThrottleDeliversTheLastOfEachBurstOnce)
{
    std::string input;
    for (int i = 0; i < 5; ++i)
        input += fmt::format(
            R"({{"payload": {{"level": 3, "mxreporting_timestamp": {}}}, "category": 1, "type": "Generic"}})"
            "\n",
            i);
    input += R"({"payload": {"level": 4, "_throttle_seconds": 0}, "category": "Generic", "type": 0})"
             "\n";
    std::string output;
    auto began = std::chrono::steady_clock::now();
    EXPECT_EQ(daemon.runToEnd({MXREPORT_PATH, "stream", "--throttle", "-v"}, output, input), 0) << output;
    EXPECT_GE(std::chrono::steady_clock::now() - began, std::chrono::milliseconds(450)) << "held for its throttle time";
    EXPECT_THAT(output, ::testing::HasSubstr("Dropping duplicate message for level|3|mxreporting_timestamp|^|"));
    EXPECT_THAT(output, ::testing::HasSubstr("waitForCompletion. timersInFlight="));
    // A reply comes before its row is committed: the rows are waited for.
    std::vector<std::vector<std::string>> sent;
    waitUntil([&] {
        sent = daemon.query("uplink", "SELECT payload FROM messages WHERE session IS NULL ORDER BY id");
        return sent.size() >= 2;
    });
    ASSERT_EQ(sent.size(), 2u) << "one delivery a key";
    std::vector<std::string> payloads{sent[0][0], sent[1][0]};
    EXPECT_THAT(payloads,
                ::testing::UnorderedElementsAre(R"({"level":3,"mxreporting_timestamp":4})",
                                                R"({"level":4,"_throttle_seconds":0})"));
    EXPECT_EQ(daemon.runToEnd(
                  {MXREPORT_PATH, "throttle-key", R"({"b": 2, "a": "x", "systemuptime_sec": 12})", "--reporter", "42"},
                  output),
              0);
    EXPECT_EQ(output, "a|x|b|2|systemuptime_sec|^|reporterID|42|Undefined|Generic\n0.5\n");
}

// A daemon that does not answer keeps a delivery running past the completion wait:
// the stream waits it out, drops what is still held, and says so.
TEST_F(DaemonIntegrationTest, AStreamWhoseDaemonStopsAnsweringEndsWithWhatWasNotDelivered)
{
    std::string input = R"({"payload": {"first": 1, "_throttle_seconds": 0}, "category": 1, "type": 0})"
                        "\n"
                        R"({"payload": {"second": 1, "_throttle_seconds": 4}, "category": 1, "type": 0})"
                        "\n";
    daemon.signal(SIGSTOP);
    std::string output;
    int status = daemon.runToEnd({MXREPORT_PATH, "--timeout", "7", "stream", "--throttle"}, output, input);
    daemon.signal(SIGCONT);
    EXPECT_EQ(status, 1) << output;
    EXPECT_THAT(output, ::testing::HasSubstr("Giving up on waiting for completion after 5 seconds"));
    EXPECT_THAT(output, ::testing::HasSubstr("mxreport: send: No reply from the daemon in time"));
    EXPECT_THAT(output, ::testing::HasSubstr("mxreport: line 2: not delivered"));
    EXPECT_THAT(output, ::testing::Not(::testing::HasSubstr("line 1: not delivered")));
}

// Its rows gather for a second, but what was answered survives the kill: the next
// start writes it in.
TEST_F(DaemonIntegrationTest, AKilledDaemonLosesNoAnsweredRowAndStartsCleanly)
{
    auto client = connect();
    ASSERT_EQ(client->createSession(3), 0);
    client->startSession(3);
    for (int i = 0; i < 500; ++i)
        ASSERT_EQ(client->send(payloadOf(Dictionary{{"seq", i}}), 3, 1, {3}), 0);
    auto committed = [&](const std::string& store, const std::string& table) {
        auto rows = daemon.query(store, "SELECT count(*) FROM " + table);
        return rows.empty() ? 0 : std::stoi(rows[0][0]);
    };
    ASSERT_TRUE(
        waitUntil([&] { return committed("tally", "events") == 500 && committed("uplink", "messages") == 500; }));
    // Keep the daemon busy while it dies.
    std::atomic<int> answered{0};
    for (int i = 0; i < 200; ++i)
        sendAsyncPaced(*client, payloadOf(Dictionary{{"late", i}}), 3, 1, std::vector<std::int64_t>{3},
                       [&](int result) { answered += result == 0 ? 1 : 0; });
    ASSERT_TRUE(waitUntil([&] { return answered > 100; }));
    daemon.signal(SIGKILL);
    EXPECT_EQ(daemon.waitForExit(), 128 + SIGKILL);
    // Gone with the daemon, so that no restored session numbers itself in between.
    client.reset();

    for (const auto& store : {"tally", "joule", "uplink"})
        EXPECT_EQ(daemon.query(store, "PRAGMA integrity_check")[0][0], "ok") << store;
    EXPECT_GE(committed("tally", "events"), 500);
    EXPECT_GE(committed("uplink", "messages"), 500);

    daemon.start();
    EXPECT_GE(committed("tally", "events"), 500 + answered);
    EXPECT_GE(committed("uplink", "messages"), 500 + answered) << "a started session's deliveries are kept too";
    EXPECT_TRUE(daemon.waitForLog("tally.db: wrote the "));
    auto again = connect();
    ASSERT_EQ(again->createSession(4), 0);
    again->startSession(4);
    ASSERT_EQ(again->stopSession(4), 0);
    EXPECT_TRUE(waitUntil([&] { return daemon.query("uplink", "SELECT count(*) FROM sessions")[0][0] == "2"; }))
        << "backend sessions go on numbering after the crash";
}

} // namespace
} // namespace mx::testing
