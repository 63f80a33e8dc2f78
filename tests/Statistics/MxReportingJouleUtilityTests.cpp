#include "Statistics/MxReportingJouleUtility.h"

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

TEST(MxReportingJouleUtilityTest, EngineOnTimeBecomesOneEventWhateverTheCategory)
{
    FakePlatform platform;
    Dictionary host{{"HostApplicationDisplayID", "ExampleHost"}};
    Dictionary message{{"EngineOnTime", 12.5}, {"mxreporting_timestamp", 1700000000}, {"other", 1}};
    MxReportingJouleUtility::handleEvent(message, 3, 1, host);
    MxReportingJouleUtility::handleEvent(message, 0x80000008, 65535, host);
    MxReportingJouleUtility::handleEvent(Dictionary{{"mxreporting_timestamp", 1}}, 0, 0, host);
    auto events = platform.joule.events();
    ASSERT_EQ(events.size(), 2u) << "only messages with an engine-on time are logged";
    for (const auto& event : events) {
        EXPECT_EQ(event.agent, 28);
        EXPECT_EQ(event.name, "Tessera_Haptics");
        EXPECT_EQ(
            event.event,
            (Dictionary{{"EngineOnDuration", 12.5}, {"ApplicationName", "ExampleHost"}, {"TimestampEnd", 1700000000}}));
    }
    EXPECT_TRUE(platform.log.texts(MxLogLevel::Error).empty());
}

TEST(MxReportingJouleUtilityTest, MissingTimestampOrHostIsLoggedAndTheEventStillSent)
{
    FakePlatform platform;
    MxReportingJouleUtility::handleEvent(Dictionary{{"EngineOnTime", "3s"}}, 0, 0, Dictionary{});
    MxReportingJouleUtility::handleEvent(Dictionary{{"EngineOnTime", 3}, {"mxreporting_timestamp", 1}}, 0, 0,
                                         Dictionary{{"HostApplicationDisplayID", nullptr}});
    auto events = platform.joule.events();
    ASSERT_EQ(events.size(), 2u);
    EXPECT_EQ(events[0].event, (Dictionary{{"EngineOnDuration", "3s"}, {"ApplicationName", "Unknown"}}));
    EXPECT_EQ(events[1].event, (Dictionary{{"EngineOnDuration", 3}, {"TimestampEnd", 1}}));
    EXPECT_EQ(platform.log.texts(MxLogLevel::Error),
              (std::vector<std::string>{"failed to get MxReporting timestamp for joule",
                                        "failed to get app name for joule"}));
}

} // namespace
} // namespace mx::testing
