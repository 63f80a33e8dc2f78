#include "platform/linux/FileChanstat.h"

#include <fstream>

#include <gtest/gtest.h>

namespace mx::testing {
namespace {

class FileChanstatTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "chanstat-XXXXXX").string();
        directory = mkdtemp(pattern.data());
        write("Speaker/underruns", " 12\n");
        write("Speaker/Amp/clips", "-3");
        write("Haptics/Stats/pulses", "40");
        write("Haptics/Stats/deeper/ignored", "1");
        write("Other/MCA/late", "7");
        std::filesystem::create_directories(directory / "Empty");
    }
    void TearDown() override { std::filesystem::remove_all(directory); }

    void write(const std::string& relative, const std::string& text)
    {
        std::filesystem::create_directories((directory / relative).parent_path());
        std::ofstream(directory / relative) << text;
    }

    static std::vector<std::string> names(const std::optional<ChanstatChannels>& channels)
    {
        std::vector<std::string> names;
        for (const auto& channel : channels.value_or(ChanstatChannels{}))
            names.push_back(channel.name.value_or("?"));
        return names;
    }

    std::filesystem::path directory;
};

TEST_F(FileChanstatTest, QueriesMatchGroupsAndSubgroupsAndMissingOnesAreNothing)
{
    FileChanstat files(directory);
    std::optional<ChanstatError> error;
    EXPECT_EQ(names(files.copyChannelsInGroup("Speaker", std::nullopt, error)),
              (std::vector<std::string>{"clips", "underruns"}));
    EXPECT_EQ(names(files.copyChannelsInGroup("Haptics", "Stats", error)), std::vector<std::string>{"pulses"});
    EXPECT_EQ(names(files.copyChannelsInGroup(std::nullopt, "MCA", error)), std::vector<std::string>{"late"});
    EXPECT_EQ(files.copyChannelsInGroup("Empty", std::nullopt, error), ChanstatChannels{});
    EXPECT_EQ(files.copyChannelsInGroup("Missing", std::nullopt, error), std::nullopt);
    EXPECT_EQ(FileChanstat(directory / "none").copyChannelsInGroup(std::nullopt, "MCA", error), std::nullopt);
    EXPECT_FALSE(error);
}

TEST_F(FileChanstatTest, SamplesAndDeltasReadTheSubscribedFilesAndFailWithTheirErrno)
{
    FileChanstat files(directory);
    std::optional<ChanstatError> error;
    ChanstatChannels subscribed;
    files.createSubscription(*files.copyChannelsInGroup("Speaker", std::nullopt, error), subscribed);
    write("Speaker/later", "1"); // not part of the subscription
    write("Speaker/underruns", "9223372036854775806");
    auto before = files.createSamples(1, subscribed, error);
    ASSERT_TRUE(before);
    EXPECT_EQ((*before)[0].value, -3);
    write("Speaker/underruns", "-9223372036854775807");
    write("Speaker/Amp/clips", "7");
    auto after = files.createSamples(1, subscribed, error);
    auto delta = files.createSamplesDelta(&*before, *after, error);
    ASSERT_TRUE(delta);
    EXPECT_EQ(delta->size(), 2u);
    EXPECT_EQ((*delta)[0].value, 10);
    EXPECT_EQ((*delta)[1].value, 3) << "a counter that wrapped around still grew by 3";
    EXPECT_FALSE(error);

    EXPECT_FALSE(files.createSamplesDelta(nullptr, *after, error));
    EXPECT_EQ(error->code, ENOENT);
    write("Speaker/underruns", "twelve");
    error.reset();
    EXPECT_FALSE(files.createSamples(1, subscribed, error));
    EXPECT_EQ(error->code, EINVAL);
    std::filesystem::remove(directory / "Speaker/underruns");
    error.reset();
    EXPECT_FALSE(files.createSamples(1, subscribed, error));
    EXPECT_EQ(error->code, ENOENT);
}

} // namespace
} // namespace mx::testing
