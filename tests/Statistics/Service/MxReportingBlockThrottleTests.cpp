#include "Statistics/Service/MxReportingBlockThrottle.h"

#include <future>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

using ::testing::ElementsAre;
using Throttle = MxReportingBlockThrottle;

TEST(MxReportingBlockThrottleKeyTest, KeysSortNamesAndLeaveExemptValuesOut)
{
    EXPECT_EQ(Throttle::buildMessageKey(Dictionary{{"b", 2}, {"a", "x"}, {"systemuptime_sec", 12}}, 42, 0, 0),
              "a|x|b|2|systemuptime_sec|^|reporterID|42|Undefined|Generic");
    EXPECT_EQ(Throttle::buildMessageKey(Dictionary{}, -7, 0x08000003, 1), "reporterID|-7|Session_Playback|Start");
    EXPECT_EQ(Throttle::buildMessageKey(Dictionary{{"a", 1}, {"B", 2}, {"10", 3}, {"9", 4}}, 0, 0, 0),
              "10|3|9|4|B|2|a|1|reporterID|0|Undefined|Generic");
    auto key = [](const Dictionary& message) {
        return Throttle::buildMessageKey(message, 1, 3, 1);
    };
    EXPECT_EQ(key({{"v", 1}, {"mxreporting_timestamp", 5}}), key({{"v", 1}, {"mxreporting_timestamp", 6}}));
    EXPECT_NE(key({{"v", 1}, {"mxreporting_timestamp", 5}}), key({{"v", 1}})) << "the name still counts";
    EXPECT_EQ(key({{"count", 1}, {"_comparison_field_blacklist", Array{"count"}}}),
              key({{"count", 2}, {"_comparison_field_blacklist", Array{"count"}}}));
    EXPECT_EQ(key({{"Volume", 0.5}, {"VolumeOperationTime", 1}}), key({{"Volume", 0.7}, {"VolumeOperationTime", 2}}));
    EXPECT_NE(key({{"Volume", 0.5}}), key({{"Volume", 0.7}})) << "the volume alone is compared";
}

TEST(MxReportingBlockThrottleKeyTest, ThrottleTimesAreTheMessagesOwnWithinTheirLimit)
{
    FakePlatform platform;
    auto time = [](Value seconds) {
        return Throttle::determineSleepTime(Dictionary{{"_throttle_seconds", seconds}});
    };
    EXPECT_EQ(Throttle::determineSleepTime(Dictionary{}), 0.5);
    EXPECT_EQ(time(4.99), double(4.99f)) << "single precision, widened";
    EXPECT_EQ(time(4.9), double(4.9f)) << "the limit is on the whole part";
    EXPECT_EQ(time(-1), -1.0);
    EXPECT_EQ(time(0), 0.0);
    EXPECT_TRUE(platform.log.texts().empty());
    EXPECT_EQ(time(5), 0.5);
    EXPECT_EQ(time(18446744073709551615ull), 0.5);
    EXPECT_EQ(time("3"), 0.5);
    EXPECT_THAT(platform.log.texts(MxLogLevel::Info),
                ElementsAre("Rejecting large throttle time. {time=5, max=5.000000}",
                            "Rejecting large throttle time. {time=18446744073709551615, max=5.000000}",
                            "Rejecting non KvNumber value of throttle time. {time=3}"));
}

class MxReportingBlockThrottleTest : public ::testing::Test {
protected:
    // The throttle goes before the log its worker writes to.
    void TearDown() override
    {
        throttle->invalidate();
        throttle.reset();
        platform.log.clear();
    }

    void add(const Dictionary& message, std::function<void()> block)
    {
        throttle->addMessageBlock(std::move(block), 7, message, 3, 1);
    }

    FakePlatform platform;
    std::shared_ptr<Throttle> throttle = Throttle::make();
    std::mutex mutex;
    std::vector<std::string> delivered;
    std::function<void()> deliver(const std::string& name)
    {
        return [this, name] {
            std::lock_guard lock(mutex);
            delivered.push_back(name);
        };
    }
};

TEST_F(MxReportingBlockThrottleTest, ABurstDeliversItsLastMessageOnceAndKeysInFireDateOrder)
{
    auto began = std::chrono::steady_clock::now();
    // The earlier fire date first: however the worker's passes fall between the adds,
    // it is due first.
    add({{"other", 1}, {"_throttle_seconds", 0.1}}, deliver("other"));
    add({{"level", 1}, {"_throttle_seconds", 0.3}}, deliver("first of burst"));
    add({{"level", 1}, {"_throttle_seconds", 0.3}}, deliver("last of burst"));
    throttle->waitForCompletion();
    EXPECT_GE(std::chrono::steady_clock::now() - began, std::chrono::milliseconds(250));
    std::lock_guard lock(mutex);
    EXPECT_THAT(delivered, ElementsAre("other", "last of burst"));
    auto texts = platform.log.texts();
    EXPECT_TRUE(std::any_of(texts.begin(), texts.end(), [](const std::string& text) {
        return text.starts_with("waitForCompletion. timersInFlight=");
    }));
}

TEST_F(MxReportingBlockThrottleTest, ADeliveryThatThrowsLeavesAndTheOthersStillRun)
{
    add({{"a", 1}, {"_throttle_seconds", 0}}, [] { throw std::runtime_error("delivery broke"); });
    add({{"b", 1}, {"_throttle_seconds", 0.3}}, deliver("held beside it"));
    throttle->waitForCompletion();
    EXPECT_TRUE(platform.log.contains("a held delivery failed: delivery broke"));
    EXPECT_FALSE(platform.log.contains("Giving up on waiting for completion after 5 seconds. timersInFlight=1"));
    add({{"a", 1}, {"_throttle_seconds", -1}}, deliver("again"));
    throttle->waitForCompletion();
    std::lock_guard lock(mutex);
    EXPECT_THAT(delivered, ElementsAre("held beside it", "again"));
}

TEST_F(MxReportingBlockThrottleTest, WaitingGivesUpAfterFiveSecondsAndTheDeliveryStillRuns)
{
    std::promise<void> released;
    add({{"slow", 1}, {"_throttle_seconds", 0}}, [future = released.get_future().share()] { future.wait(); });
    throttle->waitForCompletion();
    EXPECT_TRUE(platform.log.contains("Giving up on waiting for completion after 5 seconds. timersInFlight=1"));
    released.set_value();
    throttle->waitForCompletion();
    EXPECT_EQ(platform.log.count("Giving up on waiting for completion after 5 seconds. timersInFlight=1"), 1u)
        << "the second wait saw it run";
}

TEST_F(MxReportingBlockThrottleTest, InvalidatingWaitsForTheRunningDeliveryAndDropsTheHeldOnes)
{
    std::promise<void> running;
    std::promise<void> released;
    add({{"slow", 1}, {"_throttle_seconds", 0}}, [&running, future = released.get_future().share()] {
        running.set_value();
        future.wait();
    });
    add({{"later", 1}, {"_throttle_seconds", 4}}, deliver("later"));
    running.get_future().wait();
    auto ended = std::async(std::launch::async, [&] { return throttle->invalidate(); });
    EXPECT_EQ(ended.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout)
        << "a running delivery is waited for";
    released.set_value();
    EXPECT_THAT(ended.get(), ElementsAre(Throttle::buildMessageKey({{"later", 1}, {"_throttle_seconds", 4}}, 7, 3, 1)));
    add({{"after", 1}, {"_throttle_seconds", 0}}, deliver("after"));
    EXPECT_EQ(throttle.use_count(), 1) << "the worker has let go";
    std::lock_guard lock(mutex);
    EXPECT_TRUE(delivered.empty());
}

// A message accepted while the worker is ending is never placed on its loop; its
// timer still belongs to that loop and must go before it.
TEST(MxReportingBlockThrottleLifetimeTest, AMessageNeverPlacedGoesCleanlyWithTheThrottle)
{
    FakePlatform platform;
    auto throttle = Throttle::make();
    throttle->setShouldKeepRunning(false);
    throttle->addMessageBlock([] {}, 7, {{"never placed", 1}, {"_throttle_seconds", 4}}, 3, 1);
    std::weak_ptr<Throttle> ending = throttle;
    throttle.reset();
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (!ending.expired() && std::chrono::steady_clock::now() < deadline)
        std::this_thread::yield();
    EXPECT_TRUE(ending.expired());
    // Through the log's lock: the worker's last line is then seen before the log goes.
    platform.log.clear();
}

} // namespace
} // namespace mx::testing
