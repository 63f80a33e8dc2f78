// The server queue, the session queues and the clients' threads, for real: many
// clients send while sessions are stopped and restarted under them. Run under the
// tsan preset, this is the test that finds races between queues.

#include <future>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Statistics/Service/MxReportingServerInstance.h"
#include "fakes/FakePlatform.h"
#include "fakes/ServiceHostHarness.h"
#include "platform/linux/AsioDispatch.h"

namespace mx::testing {
namespace {

constexpr auto kBound = std::chrono::seconds(60);

class Countdown {
public:
    explicit Countdown(int count) : count_(count) {}
    void arrive()
    {
        std::lock_guard lock(mutex_);
        if (--count_ == 0)
            done_.notify_all();
    }
    bool wait()
    {
        std::unique_lock lock(mutex_);
        return done_.wait_for(lock, kBound, [&] { return count_ <= 0; });
    }

private:
    std::mutex mutex_;
    std::condition_variable done_;
    int count_;
};

class MxReportingServerInstanceConcurrencyTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        host.start();
        for (int pid = 1; pid <= kClients; ++pid)
            clients.push_back(host.connect(pid));
        Countdown ready(kClients * 2 * 2);
        for (int c = 0; c < kClients; ++c)
            for (ReporterID id : ownIDs(c)) {
                clients[c]->createReportingSession(id, [&](bool) { ready.arrive(); });
                clients[c]->setServiceType(7, id, [&](bool) { ready.arrive(); });
                clients[c]->startReportingSessionForID(id, [](bool) {}); // held until a stop
            }
        ASSERT_TRUE(ready.wait());
    }

    static std::vector<ReporterID> ownIDs(int client) { return {100 + client * 10 + 1, 100 + client * 10 + 2}; }

    // Runs a marker through the server queue: every delivery of a report answered
    // before it is made, for sessions whose discovery answered at once deliver in place.
    void drainServerQueue()
    {
        std::promise<void> reached;
        host.root->serverQueue()->dispatch([&] { reached.set_value(); });
        ASSERT_EQ(reached.get_future().wait_for(kBound), std::future_status::ready);
    }

    static constexpr int kClients = 4;
    static constexpr int kMessagesPerClient = 400;

    FakePlatform platform;
    AsioDispatch dispatch{2};
    ScopedInstall<Dispatch> installDispatch{dispatch};
    ServiceHostHarness host{[this] {
        std::promise<void> reached;
        host.root->serverQueue()->dispatch([&] { reached.set_value(); });
        reached.get_future().wait();
    }};
    std::vector<std::shared_ptr<MxReportingServerInstance>> clients;
};

TEST_F(MxReportingServerInstanceConcurrencyTest, EveryMessageIsRepliedOnceAndDeliveredInOrderDespiteRestarts)
{
    Countdown replies(kClients * kMessagesPerClient);
    std::atomic<int> errors{0};
    std::vector<std::thread> senders;
    senders.reserve(kClients);
    for (int c = 0; c < kClients; ++c)
        senders.emplace_back([&, c] {
            // Each client reports to its own sessions and to one of its neighbour's.
            auto neighbour = ownIDs((c + 1) % kClients)[0];
            for (int seq = 0; seq < kMessagesPerClient; ++seq) {
                Array ids{ownIDs(c)[0], ownIDs(c)[1], neighbour};
                clients[c]->sendMessage(Dictionary{{"sender", c}, {"seq", seq}, {"peak level", seq % 7}}, 0x08000003, 1,
                                        ids, [&](const std::optional<MxReportingError>& error) {
                                            errors += error ? 1 : 0;
                                            replies.arrive();
                                        });
            }
        });
    std::thread restarter([&] {
        for (int round = 0; round < 50; ++round)
            for (ReporterID id : ownIDs(0)) {
                clients[0]->stopReportingSessionForID(id, [](bool) {});
                clients[0]->startReportingSessionForID(id, [](bool) {});
            }
    });
    for (auto& sender : senders)
        sender.join();
    restarter.join();
    ASSERT_TRUE(replies.wait());
    EXPECT_EQ(errors, 0);

    drainServerQueue();
    EXPECT_EQ(platform.tally.events().size(), static_cast<std::size_t>(kClients * kMessagesPerClient * 3));

    // Within each backend session, each sender's messages arrive in the order sent.
    std::size_t delivered = 0;
    for (const auto& backend : platform.uplink.sessions()) {
        std::map<std::int64_t, std::int64_t> lastSeq;
        for (const auto& message : backend->messages()) {
            if (message.type == message_type::kSummary)
                continue;
            const Value* sender = message.payload.find("sender");
            ++delivered;
            auto seq = message.payload.find("seq")->int64Value();
            auto [last, inserted] = lastSeq.try_emplace(sender->int64Value(), seq);
            if (!inserted) {
                EXPECT_LT(last->second, seq);
                last->second = seq;
            }
            EXPECT_TRUE(message.payload.contains("peak_level"));
        }
    }
    std::size_t expected = std::size_t{kClients} * kMessagesPerClient * 3;
    ASSERT_LE(delivered, expected);
    platform.uplink.waitForOneShots(expected - delivered, kBound);
    std::size_t alone = 0;
    for (const auto& oneShot : platform.uplink.oneShots())
        alone += oneShot.payload.contains("sender") ? 1 : 0;
    EXPECT_EQ(delivered + alone, expected) << "every message reaches the backend, in a session or alone";
}

} // namespace
} // namespace mx::testing
