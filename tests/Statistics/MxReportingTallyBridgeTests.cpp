#include "Statistics/MxReportingTallyBridge.h"

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

TEST(MxReportingTallyBridgeTest, EventKeepsTheClientsKeysAndSetsTheHostLast)
{
    FakePlatform platform;
    MxReportingTallyBridge::handleEvent(Dictionary{{"a b", 1}}, 0x08000003, 1,
                                        Dictionary{{"HostApplicationDisplayID", "ExampleHost"}});
    MxReportingTallyBridge::handleEvent(Dictionary{{"HostApplicationDisplayID", "x"}}, 0x30000002, 4, Dictionary{});
    MxReportingTallyBridge::handleEvent(Dictionary{}, 0xFFFFFFFF, 65535, Dictionary{});
    auto events = platform.tally.events();
    ASSERT_EQ(events.size(), 3u);
    EXPECT_EQ(events[0].name, "com.kestrel.harmonia.Session_Playback.Start");
    EXPECT_EQ(events[0].payload, (Dictionary{{"a b", 1}, {"HostApplicationDisplayID", "ExampleHost"}}));
    EXPECT_EQ(events[1].name, "com.kestrel.harmonia._Record.Error");
    EXPECT_EQ(events[1].payload, (Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
    EXPECT_EQ(events[2].name, "com.kestrel.harmonia.Undefined.Unknown");
}

} // namespace
} // namespace mx::testing
