#include "Statistics/MxReportingDriverUtility.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/FakeChanstat.h"
#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

using ::testing::ElementsAre;

ChanstatChannel channel(const std::string& path, std::optional<std::string> name) { return {std::move(name), path, 0}; }

class MxReportingDriverUtilityTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        chanstat.groups[{"Speaker", std::nullopt}] = {};
        chanstat.groups[{std::nullopt, "MCA"}] = {channel("mca/a", "dropouts"), channel("mca/b", "late")};
        chanstat.groups[{"Haptics", "Stats"}] = {channel("haptics/x", "pulses"), channel("haptics/y", std::nullopt)};
        chanstat.queryErrors[{"KestrelAE2MCA", std::nullopt}] = 13;
    }

    FakePlatform platform;
    FakeChanstat chanstat;
};

TEST_F(MxReportingDriverUtilityTest, SubscribesToTheDriversThatHaveChannelsAndSaysSoForEach)
{
    MxReportingDriverUtility sampler(chanstat);
    ASSERT_EQ(sampler.ioChannelSubscriptions().size(), 2u);
    EXPECT_EQ(sampler.ioChannelSubscriptions()[0].driver.description(), "(null)-MCA");
    EXPECT_EQ(sampler.ioChannelSubscriptions()[1].driver.description(), "Haptics-Stats");
    EXPECT_THAT(platform.log.texts(),
                ElementsAre("creating driverstats driver utility",
                            "error 13 getting channels for driver KestrelAE2MCA-(null)",
                            "couldn't find any channels for driver group Speaker-(null)",
                            "subscribed to group group Speaker-(null)", "subscribed to group group (null)-MCA",
                            "subscribed to group group Haptics-Stats"));
}

TEST_F(MxReportingDriverUtilityTest, GrowthOfAtLeastOneIsReportedUnderDriverAndChannelNames)
{
    MxReportingDriverUtility sampler(chanstat);
    chanstat.values = {{"mca/a", 10}, {"mca/b", 5}, {"haptics/x", 7}, {"haptics/y", 1}};
    auto snapShot = sampler.getSnapShot();
    EXPECT_EQ(snapShot.size(), 2u);
    chanstat.values = {{"mca/a", 13}, {"mca/b", 4}, {"haptics/x", 7}, {"haptics/y", 3}};
    EXPECT_EQ(sampler.getDriverStatisticsRelativeToSnapShot(&snapShot),
              (Dictionary{{"MCA_dropouts", 3}, {"Haptics_Stats_", 2}}))
        << "no key for a channel that went down or stood still";
    EXPECT_EQ(sampler.getDriverStatisticsRelativeToSnapShot(nullptr),
              (Dictionary{{"MCA_dropouts", 13}, {"MCA_late", 4}, {"Haptics_Stats_pulses", 7}, {"Haptics_Stats_", 3}}))
        << "without a snapshot, absolute values";

    // A driver that cannot be sampled fails alone; one missing from the snapshot is
    // reported in absolute values.
    chanstat.failingPaths["mca/b"] = true;
    MxReportingDriverSnapShot partial{{"(null)-MCA", snapShot["(null)-MCA"]}};
    platform.log.clear();
    chanstat.values["haptics/x"] = 9;
    EXPECT_EQ(sampler.getDriverStatisticsRelativeToSnapShot(&partial),
              (Dictionary{{"Haptics_Stats_pulses", 9}, {"Haptics_Stats_", 3}}));
    EXPECT_THAT(platform.log.texts(MxLogLevel::Error),
                ElementsAre("ChanstatCreateSamples error 2", "ChanstatCreateSamplesDelta error 2"));
    chanstat.values = {};
    chanstat.failingPaths.clear();
    EXPECT_EQ(sampler.getDriverStatisticsRelativeToSnapShot(nullptr), std::nullopt) << "nothing grew: nothing";
}

} // namespace
} // namespace mx::testing
