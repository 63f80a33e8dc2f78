#include "Statistics/Service/MxReportingServiceDelegate.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"
#include "fakes/ServiceHostHarness.h"

namespace mx::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class MxReportingServiceDelegateTest : public ::testing::Test {
protected:
    MxReportingServiceDelegateTest() { host.start(); }

    std::shared_ptr<FakeServiceConnection> accept(pid_t pid) { return host.accept(pid); }
    std::vector<std::shared_ptr<MxReportingServerInstance>> clients() { return host.clients(); }
    void run() { platform.dispatch.runUntilIdle(); }

    // The endpoint the root made for that connection, once registered.
    MxReportingServerInstance& instance(const FakeServiceConnection& connection)
    {
        for (const auto& client : clients())
            if (client->processIdentifier() == connection.processIdentifier())
                return *client;
        throw std::logic_error("no endpoint for " + connection.description());
    }

    FakePlatform platform;
    ServiceHostHarness host{[this] {
        run();
    }};
    std::shared_ptr<MxReportingServiceDelegate>& root = host.root;
    FakePreferences& preferences = host.preferences;
    FakeNotifications& notifications = host.notifications;
    FakeProcessTable& processes = host.processes;
};

TEST_F(MxReportingServiceDelegateTest, AcceptedClientsAreRegisteredInOrderWithNameAndStartDate)
{
    processes.names[7] = "player";
    auto before = std::chrono::system_clock::now();
    auto first = accept(7);
    auto own = accept(1000);
    auto nameless = accept(0);
    EXPECT_THAT(platform.log.texts(), ::testing::Contains("newConnection: <fake connection 7>"));
    run();
    auto clients = this->clients();
    ASSERT_EQ(clients.size(), 3u);
    EXPECT_EQ(clients[0]->processIdentifier(), first->processIdentifier());
    EXPECT_EQ(clients[0]->clientProcessName(), "player");
    EXPECT_GE(*clients[0]->clientStartDate(), before);
    EXPECT_EQ(clients[1]->clientProcessName(), "mxreportingd");
    EXPECT_EQ(clients[2]->clientProcessName(), std::nullopt);
    EXPECT_TRUE(platform.log.contains("notify setup result 0"));
}

TEST_F(MxReportingServiceDelegateTest, NotificationReReadsDefaultsPushesThemAndSetsTheSwitch)
{
    auto client = accept(1);
    run();
    instance(*client).createReportingSession(5, [](bool) {});
    run();
    preferences.domains["com.kestrel.harmonia"] = Dictionary{{"disable_reporting", true}, {"device_name", "den"}};
    EXPECT_TRUE(root->isReportingEnabled()) << "nothing is read before the notification";

    notifications.deliver(999);
    run();
    EXPECT_TRUE(root->isReportingEnabled()) << "another token is ignored";
    EXPECT_FALSE(root->getDefaults());

    notifications.post("com.kestrel.harmonia.reporting");
    run();
    EXPECT_FALSE(root->isReportingEnabled());
    EXPECT_EQ(root->getDefaults(), (Dictionary{{"device_name", "den"}, {"disable_reporting", 1}}));
    auto session = instance(*client).clientReportingSessionMap().at(5);
    EXPECT_EQ(session->userInfo()->find("device_name"), Value("den"));
    EXPECT_TRUE(platform.log.contains("re-reading harmonia defaults"));

    preferences.domains["com.kestrel.harmonia"] = Dictionary{};
    notifications.post("com.kestrel.harmonia.reporting");
    run();
    EXPECT_TRUE(root->isReportingEnabled()) << "an unset key switches reporting back on";
    EXPECT_EQ(root->getDefaults(), (Dictionary{{"disable_reporting", 0}}));
}

TEST_F(MxReportingServiceDelegateTest, InvalidationStopsTheClientAndReportsItsUptimeWhateverItLacks)
{
    processes.names[7] = "player";
    auto player = accept(7);
    auto nameless = accept(0);
    auto future = accept(1000);
    run();
    instance(*player).setClientStartDate(std::chrono::system_clock::now() - std::chrono::milliseconds(1500));
    instance(*future).setClientStartDate(std::chrono::system_clock::now() + std::chrono::seconds(30));
    player->invalidation();
    nameless->invalidation();
    future->invalidation();
    root->reportClientUptime({}, 77);
    run();
    EXPECT_THAT(clients(), IsEmpty());
    EXPECT_TRUE(platform.log.contains("InvalidationHandler: connection exited process=player uptime_sec=1"));

    EXPECT_TRUE(platform.log.contains("clientProcessName is nil. clientpid=0"));
    EXPECT_TRUE(platform.log.contains("clientStartDate is in the past. clientpid=1000 clientprocessname=mxreportingd"));
    EXPECT_TRUE(platform.log.contains("clientStartDate is nil. clientpid=77 clientprocessname=unknown"));
    EXPECT_TRUE(platform.log.contains("InvalidationHandler: connection exited process=(null) uptime_sec=-1"));
    EXPECT_TRUE(platform.log.contains("clientProcessName is nil. clientpid=77"));
    auto events = platform.tally.events();
    ASSERT_EQ(events.size(), 2u) << "only named clients are reported";
    EXPECT_EQ(events[0].payload,
              (Dictionary{{"processName", "player"}, {"seconds", events[0].payload.find("seconds")->doubleValue()}}));
    EXPECT_GE(events[0].payload.find("seconds")->doubleValue(), 1.5);
    EXPECT_GE(events[1].payload.find("seconds")->doubleValue(), 29.0) << "never negative";
}

} // namespace
} // namespace mx::testing
