#include "platform/linux/FileChanstat.h"

#include <atomic>
#include <fcntl.h>
#include <fstream>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

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
    write("Speaker/Amp/clips", "");
    error.reset();
    EXPECT_FALSE(files.createSamples(1, subscribed, error));
    EXPECT_EQ(error->code, EINVAL);
    std::filesystem::remove(directory / "Speaker/underruns");
    std::filesystem::remove(directory / "Speaker/Amp/clips");
    error.reset();
    EXPECT_FALSE(files.createSamples(1, subscribed, error));
    EXPECT_EQ(error->code, ENOENT);
}

// The first channel that cannot be read now (gone, garbled, a FIFO put in its place)
// fails its driver's sample, and a delta needs every channel in the earlier sample.
TEST_F(FileChanstatTest, ABadChannelFailsItsDriversSampleAndAFifoNeverBlocks)
{
    FileChanstat files(directory);
    std::optional<ChanstatError> error;
    ChanstatChannels subscribed;
    write("Speaker/Amp/fifo", "0");
    files.createSubscription(*files.copyChannelsInGroup("Speaker", std::nullopt, error), subscribed);
    auto before = files.createSamples(1, subscribed, error);
    ASSERT_TRUE(before);
    std::filesystem::remove(directory / "Speaker/Amp/fifo");
    ASSERT_EQ(mkfifo((directory / "Speaker/Amp/fifo").c_str(), 0644), 0);
    EXPECT_FALSE(files.createSamples(1, subscribed, error));
    EXPECT_EQ(error->code, EINVAL) << "a FIFO is no channel, and reading it waits for no writer";

    ChanstatChannels fewer(before->begin() + 1, before->end());
    error.reset();
    EXPECT_FALSE(files.createSamplesDelta(&fewer, *before, error));
    EXPECT_EQ(error->code, ENOENT) << "the earlier sample lacks a channel of the later one";
}

// Garbage written with a time in the future is not a file being rewritten: it is read
// once, so that twenty such files cost a sample milliseconds, not seconds each.
TEST_F(FileChanstatTest, GarbageFromTheFutureIsFinalAtOnce)
{
    ChanstatChannels subscribed;
    for (int i = 0; i < 20; ++i) {
        std::string name = "Haptics/Stats/garbage" + std::to_string(i);
        write(name, "12x");
        timespec times[2] = {{0, UTIME_OMIT}, {std::time(nullptr) + 3600, 0}};
        ASSERT_EQ(::utimensat(AT_FDCWD, (directory / name).c_str(), times, 0), 0);
        subscribed.push_back({"garbage", (directory / name).string(), 0});
    }
    FileChanstat files(directory);
    std::optional<ChanstatError> error;
    auto began = std::chrono::steady_clock::now();
    for (int sample = 0; sample < 5; ++sample)
        EXPECT_FALSE(files.createSamples(1, subscribed, error));
    EXPECT_EQ(error->code, EINVAL);
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(2)) << "it took 27 s once";
}

// A writer that rewrites its file in place empties it first: a read between the two
// steps is read again, never taken as a value, and seldom as a failure (only when the
// writer is kept from the processor longer than a sample may take).
TEST_F(FileChanstatTest, ARewriteInPlaceIsNeverReadAsAMissingOrPartialValue)
{
    FileChanstat files(directory);
    std::optional<ChanstatError> error;
    ChanstatChannels subscribed;
    files.createSubscription(*files.copyChannelsInGroup("Haptics", "Stats", error), subscribed);
    write("Haptics/Stats/pulses", "1000457\n");
    std::atomic<bool> writing{true};
    std::thread writer([&] {
        std::string path = (directory / "Haptics/Stats/pulses").string();
        while (writing.load()) {
            int fd = ::open(path.c_str(), O_WRONLY | O_TRUNC);
            ASSERT_GE(fd, 0);
            ASSERT_EQ(::write(fd, "1000457\n", 8), 8);
            ::close(fd);
            std::this_thread::sleep_for(std::chrono::microseconds(500));
        }
    });
    int misread = 0;
    int failed = 0;
    for (int i = 0; i < 3000; ++i) {
        auto samples = files.createSamples(1, subscribed, error);
        failed += !samples;
        misread += samples && (samples->size() != 1 || (*samples)[0].value != 1000457);
    }
    writing.store(false);
    writer.join();
    EXPECT_EQ(misread, 0);
    EXPECT_LT(failed, 30);
}

} // namespace
} // namespace mx::testing
