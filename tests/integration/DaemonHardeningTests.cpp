// What no client can do to the daemon or to the other clients, and what no file
// under its root can do to it: bounds, fairness and odd files, against the real
// daemon in a private root.

#include <atomic>
#include <future>
#include <map>
#include <mutex>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "integration/IntegrationHelpers.h"

namespace mx::testing {
namespace {

class DaemonHardeningTest : public ::testing::Test {
protected:
    void SetUp() override { daemon.start(); }
    std::unique_ptr<mxr::Client> connect() { return connectTo(daemon); }

    DaemonProcess daemon;
};

std::vector<std::pair<std::string, Array>> creates(std::int64_t first, std::int64_t last)
{
    std::vector<std::pair<std::string, Array>> requests;
    for (std::int64_t id = first; id <= last; ++id)
        requests.push_back({"createReportingSession:reply:", Array{id}});
    return requests;
}

// Sessions are bounded on each connection and in the whole service, and a create past
// either is refused whole, with the limit named, never answered as if it made one. A
// held start reply is no request waiting for work: a client holding hundreds is read on.
TEST_F(DaemonHardeningTest, SessionsAreBoundedPerConnectionAndInAllAndACreatePastEitherIsRefused)
{
    RawConnection first(daemon.socketPath());
    auto answered = exchange(first, creates(1, 4097), 4097);
    EXPECT_EQ(answered[4095].result, Value(true));
    EXPECT_EQ(answered[4096].error,
              Value(Dictionary{{"code", 3}, {"message", "too many sessions on this connection (4096)"}}));
    EXPECT_TRUE(daemon.waitForLog("no session made for reporter 4097"));

    std::vector<std::pair<std::string, Array>> held;
    for (std::int64_t id = 1; id <= 600; ++id)
        held.push_back({"startReportingSessionForID:reply:", Array{id}});
    held.push_back({"createReportingSession:reply:", Array{1}});
    answered = exchange(first, held, 1);
    EXPECT_EQ(answered[600].result, Value(true)) << "600 held replies, and a session made anew under its own ID";

    std::vector<std::unique_ptr<RawConnection>> others;
    for (std::int64_t connection = 1; connection <= 3; ++connection) {
        others.push_back(std::make_unique<RawConnection>(daemon.socketPath()));
        auto made = exchange(*others.back(), creates(connection * 10000, connection * 10000 + 4095), 4096);
        ASSERT_EQ(made.back().result, Value(true)) << "connection " << connection;
    }
    auto client = connect();
    EXPECT_EQ(client->createSession(99999), -EMFILE) << "16384 in the service";
    std::vector<std::int64_t> reporters;
    ASSERT_EQ(client->reporters(reporters), 0);
    EXPECT_EQ(reporters.size(), 16384u);
    EXPECT_EQ(validity(*client, 99999), (Dictionary{{"reporterID", 0}, {"serviceType", 65535}})) << "nothing made";
    EXPECT_TRUE(daemon.waitForLog("too many sessions in the service (16384)"));

    EXPECT_EQ(client->destroySession(1), 0) << "not its own: destroys nothing";
    others.back().reset();
    EXPECT_TRUE(waitUntil([&] { return client->createSession(99999) == 0; }))
        << "a client that left frees its sessions";
}

// One message names at most 4096 reporters, each of which it reaches, repeats too;
// past that it is refused whole.
TEST_F(DaemonHardeningTest, AMessageNamesUpTo4096ReportersRepeatsIncluded)
{
    auto client = connect();
    ASSERT_EQ(client->createSession(5), 0);
    mxr::Payload report;
    report.add("k", 1);
    EXPECT_EQ(client->send(report, 3, 1, std::vector<std::int64_t>(4097, 5)), -E2BIG);
    EXPECT_EQ(client->send(report, 3, 1, std::vector<std::int64_t>(4096, 5)), 0);
    EXPECT_TRUE(waitUntil([&] {
        return daemon.query("tally", "SELECT count(*) FROM events WHERE name LIKE '%Playback.Start'")[0][0] == "4096";
    }));
}

// Requests that never finish arriving hold neither memory nor connections for long:
// all together at most 64 MiB (the connection waiting longest goes first), and one
// whose bytes stop for 10 s closes its connection.
TEST_F(DaemonHardeningTest, RequestsThatNeverFinishArrivingAreBoundedInBytesAndTime)
{
    // Each a large request one byte short: a string parameter of its full length.
    auto partial = [](std::size_t bytes) {
        std::string request = packed([&](auto& p) {
            p.pack_array(4), p.pack(0), p.pack(1), p.pack(std::string("createReportingSession:reply:"));
            p.pack_array(1), p.pack_str(static_cast<std::uint32_t>(bytes));
        });
        return request + std::string(bytes - 1, 'x');
    };
    std::vector<std::unique_ptr<RawConnection>> stalled;
    for (int i = 0; i < 80; ++i) {
        stalled.push_back(std::make_unique<RawConnection>(daemon.socketPath()));
        ASSERT_TRUE(stalled.back()->send(partial(1000000)));
    }
    EXPECT_TRUE(daemon.waitForLog("requests still arriving hold more than 64 MiB in all"));
    EXPECT_TRUE(stalled.front()->waitForClose()) << "the one waiting longest goes first";
    EXPECT_LT(daemon.residentBytes(), kMemoryBound + (std::size_t{80} << 20));
    auto client = connect();
    EXPECT_EQ(client->createSession(1), 0) << "the others are served";
    EXPECT_TRUE(stalled.back()->waitForClose()) << "and a request that stops arriving closes in 10 s";
    EXPECT_TRUE(daemon.waitForLog("a request stopped arriving for 10 s"));
}

// A store's bound is what an operator sees with du: the database, its log and the log's
// index together, however much was sent; and with its pending rows, never more than
// twice the bound, not even in a burst.
TEST(DaemonStoreSizeTest, AStoreStaysWithinItsBoundOnDiskLogIncluded)
{
    DaemonProcess daemon;
    daemon.writeFile("etc/harmonia/stores.json", R"({"tally": {"max_bytes": 1048576}})");
    daemon.start();
    auto onDisk = [&](std::initializer_list<const char*> suffixes) {
        std::uintmax_t bytes = 0;
        for (const char* suffix : suffixes) {
            struct stat file {};
            if (::stat(daemon.path(std::string("var/lib/harmonia/tally.db") + suffix).c_str(), &file) == 0)
                bytes += std::uintmax_t(file.st_blocks) * 512;
        }
        return bytes;
    };
    std::atomic<bool> sending{true};
    std::atomic<std::uintmax_t> most{0};
    std::string largest; // what each file took then
    std::thread watcher([&] {
        while (sending.load()) {
            auto now = onDisk({"", "-wal", "-shm", "-pending"});
            if (now > most.load()) {
                most = now;
                largest = fmt::format("db {} wal {} shm {} pending {}", onDisk({""}), onDisk({"-wal"}),
                                      onDisk({"-shm"}), onDisk({"-pending"}));
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(2));
        }
    });
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(5), 0);
    Dictionary report{{"filler", std::string(500, 'f')}};
    for (int i = 0; i < 10000; ++i)
        sendAsyncPaced(*client, payloadOf(report), 3, 1, std::vector<std::int64_t>{5}, nullptr);
    ASSERT_EQ(client->send(payloadOf(report), 3, 1, {5}), 0);
    ASSERT_TRUE(daemon.waitForLog("tally.db: pruned"));
    EXPECT_TRUE(waitUntil([&] { return onDisk({"", "-wal", "-shm"}) <= 1048576; }));
    sending = false;
    watcher.join();
    EXPECT_LE(most.load(), 2u * 1048576) << "at its largest, pending rows included: " << largest;
}

// Another user must not move the socket aside, plant a file where the daemon writes,
// or replace the metrics: every directory and file gets its own mode, whatever the
// umask the daemon was started with; and any user may read the metrics.
TEST(DaemonPermissionsTest, UnderAnOpenUmaskEveryDirectoryAndFileGetsItsOwnMode)
{
    DaemonProcess daemon;
    daemon.writeFile("etc/harmonia/device.json", R"({"InternalBuild": true})");
    // As an older version left it: the node exporter's user could not read it.
    std::filesystem::create_directories(daemon.path("var/lib/harmonia/metrics"));
    std::filesystem::permissions(daemon.path("var/lib/harmonia/metrics"), std::filesystem::perms(0750));
    mode_t previous = umask(0);
    daemon.start();
    umask(previous);
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(3), 0);
    client->startSession(3);
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"a", 1}}), 3, 1, {3}), 0);
    ASSERT_EQ(client->stopSession(3), 0);
    ASSERT_TRUE(
        waitUntil([&] { return std::filesystem::exists(daemon.path("var/lib/harmonia/metrics/mxreportingd.prom")); }));
    auto mode = [&](const std::string& relative) {
        struct stat file {};
        return ::lstat(daemon.path(relative).c_str(), &file) == 0 ? file.st_mode & 07777 : 01;
    };
    EXPECT_EQ(mode("run/harmonia"), 0755u);
    for (const char* socket : {"reporting.sock", "notify.sock", "orientation.sock"})
        EXPECT_EQ(mode(std::string("run/harmonia/") + socket), 0660u) << socket;
    EXPECT_EQ(mode("run/harmonia/mxreportingd.lock"), 0644u);
    EXPECT_EQ(mode("var/lib/harmonia"), 0755u);
    for (const char* store : {"tally.db", "tally.db-wal", "joule.db", "uplink.db"})
        EXPECT_EQ(mode(std::string("var/lib/harmonia/") + store), 0640u) << store;
    EXPECT_EQ(mode("var/lib/harmonia/metrics"), 0755u);
    EXPECT_EQ(mode("var/lib/harmonia/metrics/mxreportingd.prom"), 0644u);
    auto summary = std::filesystem::directory_iterator(daemon.path("var/log/harmonia/reporting"))->path();
    EXPECT_EQ(mode(summary.lexically_relative(daemon.root()).string()), 0640u);
}

// A client names itself (its process name) and fills its payloads: neither reaches a
// terminal or the log as anything but one printable line.
TEST_F(DaemonHardeningTest, ControlCharactersFromClientsAreEscapedInTheLogAndTheStatus)
{
    pid_t child = fork();
    if (child == 0) {
        prctl(PR_SET_NAME, "ev\x1b[2Jil\tX");
        RawConnection connection(daemon.socketPath());
        connection.send(packed([](auto& p) {
            p.pack_array(4), p.pack(0), p.pack(1), p.pack(std::string("createReportingSession:reply:"));
            p.pack_array(1), p.pack(77);
        }));
        pause();
        _exit(0);
    }
    ASSERT_TRUE(daemon.waitForLog("session created for reporter 77"));
    std::string output;
    ASSERT_EQ(daemon.runToEnd({MXREPORT_PATH, "status"}, output), 0) << output;
    EXPECT_THAT(output, ::testing::HasSubstr(fmt::format("pid {} ev\\x1b[2Jil\\tX (1 sessions)", child)));
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    EXPECT_TRUE(daemon.waitForLog("InvalidationHandler: connection exited process=ev\\x1b[2Jil\\tX uptime_sec="));
    EXPECT_THAT(daemon.log(), ::testing::Not(::testing::HasSubstr("\x1b")));
}

} // namespace
} // namespace mx::testing
