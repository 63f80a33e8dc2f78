#include "Statistics/MxReportingTallyBridge.h"

#include <gtest/gtest.h>

#include "Statistics/Service/MxReportingSession.h"
#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

class MxReportingTallyBridgeTest : public ::testing::Test {
protected:
    FakePlatform platform;
    std::shared_ptr<MxReportingSession> session = std::make_shared<MxReportingSession>(5, std::vector<std::int32_t>{1});
};

TEST_F(MxReportingTallyBridgeTest, EventKeepsTheClientsKeysAndNamesTheHost)
{
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "ExampleHost"}});
    MxReportingTallyBridge::handleEvent(Dictionary{{"a b", 1}}, 0x08000003, 1, *session);
    auto events = platform.tally.events();
    ASSERT_EQ(events.size(), 1u);
    EXPECT_EQ(events[0].name, "com.kestrel.harmonia.Session_Playback.Start");
    EXPECT_EQ(events[0].payload, (Dictionary{{"a b", 1}, {"HostApplicationDisplayID", "ExampleHost"}}));
}

TEST_F(MxReportingTallyBridgeTest, HostInTheMessageIsOverwritten)
{
    MxReportingTallyBridge::handleEvent(Dictionary{{"HostApplicationDisplayID", "x"}}, 0x30000002, 4, *session);
    MxReportingTallyBridge::handleEvent(Dictionary{}, 0xFFFFFFFF, 65535, *session);
    auto events = platform.tally.events();
    ASSERT_EQ(events.size(), 2u);
    EXPECT_EQ(events[0].name, "com.kestrel.harmonia._Record.Error");
    EXPECT_EQ(events[0].payload, (Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
    EXPECT_EQ(events[1].name, "com.kestrel.harmonia.Undefined.Unknown");
}

} // namespace
} // namespace mx::testing
