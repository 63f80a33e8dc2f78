#include "Statistics/MxReportingJouleUtility.h"

#include <gtest/gtest.h>

#include "Statistics/Service/MxReportingSession.h"
#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

class MxReportingJouleUtilityTest : public ::testing::Test {
protected:
    FakePlatform platform;
    std::shared_ptr<MxReportingSession> session = std::make_shared<MxReportingSession>(5, std::vector<std::int32_t>{1});
};

TEST_F(MxReportingJouleUtilityTest, EngineOnTimeBecomesOneEventWhateverTheCategory)
{
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "ExampleHost"}});
    Dictionary message{{"EngineOnTime", 12.5}, {"mxreporting_timestamp", 1700000000}, {"other", 1}};
    MxReportingJouleUtility::handleEvent(message, 3, 1, *session);
    session->setServiceType(4);
    MxReportingJouleUtility::handleEvent(message, 0x80000008, 65535, *session);
    auto events = platform.joule.events();
    ASSERT_EQ(events.size(), 2u);
    for (const auto& event : events) {
        EXPECT_EQ(event.agent, 28);
        EXPECT_EQ(event.name, "Tessera_Haptics");
        EXPECT_EQ(event.event, (Dictionary{{"EngineOnDuration", 12.5},
                                           {"ApplicationName", "ExampleHost"},
                                           {"TimestampEnd", 1700000000}}));
    }
    EXPECT_TRUE(platform.log.texts(MxLogLevel::Error).empty());
}

TEST_F(MxReportingJouleUtilityTest, MissingTimestampOrHostIsLoggedAndTheEventStillSent)
{
    MxReportingJouleUtility::handleEvent(Dictionary{{"EngineOnTime", "3s"}}, 0, 0, *session);
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", nullptr}});
    MxReportingJouleUtility::handleEvent(Dictionary{{"EngineOnTime", 3}, {"mxreporting_timestamp", 1}}, 0, 0, *session);
    auto events = platform.joule.events();
    ASSERT_EQ(events.size(), 2u);
    EXPECT_EQ(events[0].event, (Dictionary{{"EngineOnDuration", "3s"}, {"ApplicationName", "Unknown"}}));
    EXPECT_EQ(events[1].event, (Dictionary{{"EngineOnDuration", 3}, {"TimestampEnd", 1}}));
    EXPECT_EQ(platform.log.texts(MxLogLevel::Error),
              (std::vector<std::string>{"failed to get MxReporting timestamp for joule", "failed to get app name for joule"}));
}

TEST_F(MxReportingJouleUtilityTest, MessagesWithoutEngineOnTimeLeaveNoTrace)
{
    MxReportingJouleUtility::handleEvent(Dictionary{{"mxreporting_timestamp", 1}}, 0, 0, *session);
    EXPECT_TRUE(platform.joule.events().empty());
    EXPECT_TRUE(platform.log.texts(MxLogLevel::Error).empty());
}

} // namespace
} // namespace mx::testing
