// libmxreporting through its C API, against the real daemon: real-time sends under a
// seccomp filter, a client carrying on across the daemon's restart, the errors it says,
// and the block throttle from C.

#include <csignal>
#include <cstring>
#include <future>
#include <mutex>
#include <set>
#include <thread>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "integration/IntegrationHelpers.h"

namespace mx::testing {
namespace {

using ::testing::HasSubstr;

// The library's own lines, kept for the test to read.
class LibraryLog {
public:
    LibraryLog() { mxr_set_log_function(&LibraryLog::write, this); }
    ~LibraryLog() { mxr_set_log_function(nullptr, nullptr); }

    bool contains(const std::string& text)
    {
        std::lock_guard lock(mutex_);
        return std::any_of(lines_.begin(), lines_.end(),
                           [&](const std::string& line) { return line.find(text) != std::string::npos; });
    }

private:
    static void write(int, const char* line, void* self)
    {
        auto* log = static_cast<LibraryLog*>(self);
        std::lock_guard lock(log->mutex_);
        log->lines_.emplace_back(line);
    }

    std::mutex mutex_;
    std::vector<std::string> lines_;
};

int count(const DaemonProcess& daemon, const std::string& where)
{
    return std::stoi(daemon.query("tally", "SELECT count(*) FROM events WHERE " + where)[0][0]);
}

TEST(LibraryRealtimeTest, RealTimeSendsNeitherAllocateNorCallTheKernelButToWake)
{
    DaemonProcess daemon;
    daemon.start();
    std::string output;
    EXPECT_EQ(daemon.runToEnd({MXREPORTING_REALTIME_PROBE_PATH, "2000"}, output), 0) << output;
    EXPECT_THAT(output, HasSubstr("2000 reports: 2000 taken, 0 dropped, 0 failed, 0 allocations"));
    EXPECT_TRUE(
        waitUntil([&] { return count(daemon, "name = 'com.kestrel.harmonia.Session_Playback.Start'") == 2000; }));
}

// The daemon is stopped with reports in flight, killed, and started anew: the client
// restores its session as it was before anything else, sends what was in flight again,
// and a call made meanwhile waits for all of it.
TEST(LibraryRestartTest, SessionsAreRestoredAcrossARestartAndWhatWasInFlightIsSentAgain)
{
    LibraryLog log;
    DaemonProcess daemon;
    daemon.start();
    auto client = connectTo(daemon);
    ASSERT_EQ(client->createSession(7), 0);
    ASSERT_EQ(client->setServiceType(7, 7), 0);
    ASSERT_EQ(client->setConfiguration(7, payloadOf(Dictionary{{"HostApplicationDisplayID", "restarted"}})), 0);
    ASSERT_EQ(client->startSession(7), 0);
    ASSERT_EQ(client->send(payloadOf(Dictionary{{"before", 1}}), 3, 1, {7}), 0);

    daemon.signal(SIGSTOP);
    constexpr int kInFlight = 50;
    std::atomic<int> taken{0};
    std::atomic<int> failed{0};
    for (int i = 0; i < kInFlight; ++i)
        client->sendAsync(payloadOf(Dictionary{{"in flight", i}}), 3, 1, std::vector<std::int64_t>{7},
                          [&](int result) { ++(result == 0 ? taken : failed); });
    daemon.signal(SIGKILL);
    ASSERT_EQ(daemon.waitForExit(), 128 + SIGKILL);
    auto meanwhile = std::async(std::launch::async, [&] {
        return client->send(payloadOf(Dictionary{{"meanwhile", 1}}), 3, 1, {7});
    });
    daemon.start();

    EXPECT_EQ(meanwhile.get(), 0) << "a call made during the outage waits for the new daemon";
    EXPECT_TRUE(waitUntil([&] { return taken + failed == kInFlight; }));
    EXPECT_EQ(taken, kInFlight) << "what was in flight is sent again";
    EXPECT_EQ(validity(*client, 7), (Dictionary{{"reporterID", 7}, {"serviceType", 7}}));
    EXPECT_TRUE(log.contains("lost"));
    EXPECT_TRUE(log.contains(": 1 sessions restored"));
    std::string text;
    ASSERT_EQ(client->status(text), 0);
    EXPECT_EQ(nlohmann::json::parse(text)["sessions_started"], 1) << "restored started";
    auto restored = "payload LIKE '%\"HostApplicationDisplayID\":\"restarted\"%'";
    EXPECT_TRUE(waitUntil([&] {
        return count(daemon, std::string("payload LIKE '%in flight%' AND ") + restored) == kInFlight &&
            count(daemon, std::string("payload LIKE '%meanwhile%' AND ") + restored) == 1;
    })) << "restored configured, and before the requests that waited";
    client.reset();
}

TEST(LibraryErrorTest, EachFailureHasItsOwnCodeAndText)
{
    DaemonProcess daemon;
    mxr_client* nobody = nullptr;
    int missing = mxr_client_open(&nobody, daemon.socketPath().c_str());
    EXPECT_EQ(missing, -ENOENT);
    EXPECT_THAT(mxr_strerror(missing), HasSubstr("is mxreportingd running?"));

    daemon.start();
    auto client = connectTo(daemon);
    mxr::Payload payload;
    EXPECT_EQ(payload.addJson("nested", "{\"a\": [1, 2"), -EINVAL);
    EXPECT_EQ(payload.addJson("nested", "{\"a\": [1, 2]}"), 0);
    daemon.writeFile("var/lib/harmonia/preferences/com.kestrel.harmonia.json", R"({"disable_reporting": true})");
    std::string output;
    ASSERT_EQ(daemon.runToEnd({MXREPORT_PATH, "notify"}, output), 0);
    EXPECT_TRUE(waitUntil([&] { return client->send(payload, 3, 1, std::nullopt) == -EPERM; }));
    EXPECT_EQ(client->createSession(3), 0) << "sessions are still made while reporting is off";

    std::set<std::string> texts;
    const int codes[] = {-EINVAL,   -ENOMEM,  -ETIMEDOUT,    -ENOTCONN, -EPROTO, -EPERM, -EAGAIN,
                         -EMSGSIZE, -EDEADLK, -ENAMETOOLONG, -EMFILE,   -E2BIG,  -ENOSPC};
    for (int error : codes)
        texts.insert(mxr_strerror(error));
    EXPECT_EQ(texts.size(), std::size(codes)) << "every code the library returns says what it means";
}

// Requests the daemon would close the connection on are refused before they are sent,
// and the connection they would have cost serves on.
TEST(LibraryErrorTest, WhatTheDaemonWouldRefuseIsNeverSent)
{
    LibraryLog log;
    DaemonProcess daemon;
    daemon.start();
    auto client = connectTo(daemon);
    std::string nested = "1";
    for (int depth = 1; depth < 61; ++depth)
        nested = "[" + nested + "]";
    mxr::Payload deepest;
    ASSERT_EQ(deepest.addJson("n", nested.c_str()), 0);
    EXPECT_EQ(client->send(deepest, 3, 1, std::nullopt), 0) << "as deep as the daemon reads";
    mxr::Payload deeper;
    ASSERT_EQ(deeper.addJson("n", ("[" + nested + "]").c_str()), 0);
    EXPECT_EQ(client->send(deeper, 3, 1, std::nullopt), -EINVAL);
    mxr::Payload large;
    ASSERT_EQ(large.add("text", std::string(std::size_t{1} << 20, 'x')), 0);
    EXPECT_EQ(client->send(large, 3, 1, std::nullopt), -EMSGSIZE);
    EXPECT_EQ(client->sendAsync(large, 3, 1, std::nullopt, [](int) { ADD_FAILURE() << "never called"; }), -EMSGSIZE);
    EXPECT_EQ(client->send(payloadOf(Dictionary{{"after", 1}}), 3, 1, std::nullopt), 0);
    EXPECT_FALSE(log.contains("lost")) << "the connection never broke";

    mxr_client* far = nullptr;
    EXPECT_EQ(mxr_client_open(&far, ("/" + std::string(200, 'x')).c_str()), -ENAMETOOLONG);
    mxr_field field{"rate", MXR_INT, {48000}}; // the kinds are at file scope, in C++ as in C
    EXPECT_EQ(client->sendRealtime(0, 3, 1, &field, 1), 0);
}

// While the daemon is away, what waits is the ring and a bounded number of
// asynchronous sends; past them reports are dropped and counted, and what waited goes
// once the daemon is back.
TEST(LibraryRestartTest, WhatWaitsForAnAbsentDaemonIsBounded)
{
    LibraryLog log;
    DaemonProcess daemon;
    daemon.start();
    auto client = connectTo(daemon);
    daemon.signal(SIGKILL);
    ASSERT_EQ(daemon.waitForExit(), 128 + SIGKILL);
    ASSERT_TRUE(waitUntil([&] { return log.contains("reconnecting"); }));

    mxr_field field{"rate", MXR_INT, {48000}};
    int full = 0;
    for (int i = 0; i < 2 * MXR_RT_SLOTS; ++i)
        full += client->sendRealtime(0, 3, 1, &field, 1) == -EAGAIN;
    EXPECT_EQ(full, MXR_RT_SLOTS) << "the ring holds what it holds, and no more is taken out of it";
    std::atomic<int> answered{0};
    int refused = 0;
    auto payload = payloadOf(Dictionary{{"waiting", 1}});
    for (int i = 0; i < 5000; ++i)
        refused += client->sendAsync(payload, 3, 1, std::nullopt, [&](int) { ++answered; }) == -EAGAIN;
    EXPECT_EQ(refused, 5000 - 4096);
    std::uint64_t dropped = 0;
    ASSERT_EQ(mxr_client_get_async_dropped(client->get(), &dropped), 0);
    EXPECT_EQ(dropped, 5000u - 4096u);

    daemon.start();
    EXPECT_TRUE(waitUntil([&] {
        std::uint64_t sent = 0;
        mxr_client_get_rt_counts(client->get(), &sent, nullptr, nullptr);
        return sent == MXR_RT_SLOTS && answered == 4096;
    })) << "what waited went once the daemon was back: "
        << answered << " answered";
    std::uint64_t sent = 0, failed = 0;
    mxr_client_get_rt_counts(client->get(), &sent, nullptr, &failed);
    EXPECT_EQ(sent, MXR_RT_SLOTS) << failed << " failed";
}

// A peer that answers garbage: what was in flight fails with -EPROTO at once, and the
// reconnections slow down rather than loop, said once.
TEST(LibraryRestartTest, APeerThatAnswersGarbageFailsAtOnceAndIsRetriedEverMoreSlowly)
{
    LibraryLog log;
    DaemonProcess daemon; // for its private root only
    auto path = daemon.socketPath();
    std::filesystem::create_directories(path.parent_path());
    int listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    ASSERT_EQ(::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener, 16), 0);
    std::atomic<int> connections{0};
    std::atomic<bool> serving{true};
    std::thread peer([&] {
        while (serving) {
            int connection = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
            if (connection < 0)
                return;
            ++connections;
            char request[4096];
            if (::read(connection, request, sizeof request) > 0) [[maybe_unused]]
                auto written = ::write(connection, "\xc1\xc1\xc1", 3);
            ::close(connection);
        }
    });

    mxr_client* raw = nullptr;
    ASSERT_EQ(mxr_client_open(&raw, path.c_str()), 0);
    auto begun = std::chrono::steady_clock::now();
    mxr::Payload payload;
    EXPECT_EQ(mxr_send(raw, payload.get(), 3, 1, nullptr, 0), -EPROTO);
    EXPECT_LT(std::chrono::steady_clock::now() - begun, std::chrono::seconds(5)) << "not at the timeout";
    // 50 ms doubling: about six attempts in three seconds, not sixty.
    std::this_thread::sleep_for(std::chrono::seconds(3));
    EXPECT_LE(connections.load(), 8);
    EXPECT_TRUE(log.contains("broke at once"));
    mxr_client_close(raw);
    serving = false;
    ::shutdown(listener, SHUT_RDWR);
    peer.join();
    ::close(listener);
}

// Deliveries and what the throttle says it is done with, by user data.
struct ThrottleRecord {
    std::mutex mutex;
    std::vector<int> delivered;
    std::vector<int> released;
};
ThrottleRecord throttleRecord;

TEST(LibraryThrottleTest, ABurstDeliversItsLastOnceAndEveryUserDataIsReleasedOnce)
{
    auto deliver = [](void* data) {
        std::lock_guard lock(throttleRecord.mutex);
        throttleRecord.delivered.push_back(*static_cast<int*>(data));
    };
    auto release = [](void* data) {
        std::lock_guard lock(throttleRecord.mutex);
        throttleRecord.released.push_back(*static_cast<int*>(data));
    };
    static int data[] = {1, 2, 3, 4};
    mxr_throttle* throttle = nullptr;
    ASSERT_EQ(mxr_throttle_new(&throttle), 0);
    mxr::Payload burst;
    burst.add("level", 1);
    burst.add("_throttle_seconds", 0.2);
    for (int i = 0; i < 3; ++i)
        ASSERT_EQ(mxr_throttle_submit(throttle, 5, burst.get(), 3, 1, deliver, release, &data[i]), 0);
    EXPECT_EQ(mxr_throttle_wait(throttle), 0);
    mxr::Payload slow;
    slow.add("other", 1);
    slow.add("_throttle_seconds", 4);
    ASSERT_EQ(mxr_throttle_submit(throttle, 5, slow.get(), 3, 1, deliver, release, &data[3]), 0);
    mxr_throttle_free(throttle);

    std::lock_guard lock(throttleRecord.mutex);
    EXPECT_THAT(throttleRecord.delivered, ::testing::ElementsAre(3));
    EXPECT_THAT(throttleRecord.released, ::testing::UnorderedElementsAre(1, 2, 3, 4))
        << "the replaced, the delivered and the dropped alike";
}

} // namespace
} // namespace mx::testing
