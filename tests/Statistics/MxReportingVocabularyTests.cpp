#include "Statistics/MxReportingVocabulary.h"

#include <thread>

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

TEST(MxReportingVocabularyTest, NamesOfServiceTypesCategoriesAndMessageTypes)
{
    std::vector<std::pair<ServiceType, std::string>> serviceTypes = {
        {0, "generic"},    {2, "telephony"},   {7, "longformaudio"}, {11, "test"},      {12, "apiusage"},
        {13, "telephony"}, {100, "telephony"}, {65534, "telephony"}, {65535, "unknown"}};
    for (const auto& [code, name] : serviceTypes)
        EXPECT_EQ(MxReportingServiceTypeName(code), name) << code;

    std::vector<std::pair<MessageCategory, std::string>> categories = {{0x00000003, "Playback"},
                                                                       {0x10000008, "DSP_Error"},
                                                                       {0x30000002, "_Record"},
                                                                       {0xFFFFFFFF, "Undefined"},
                                                                       {0x80000000, "Toolbox_Undefined"},
                                                                       {0, "Undefined"},
                                                                       {12, "Undefined"},
                                                                       {0x0000FFFF, "Undefined"},
                                                                       {0x40000007, "Routing_RouteChange"},
                                                                       {0x0800000B, "Session_Volume"},
                                                                       {0x2000000A, "HAL_Performance"}};
    for (const auto& [code, name] : categories)
        EXPECT_EQ(MxReportingCategoryName(code), name) << std::hex << code;

    std::vector<std::pair<MessageType, std::string>> types = {
        {0, "Generic"}, {5, "IssueDetector"}, {6, "Undefined"}, {65535, "Unknown"}};
    for (const auto& [code, name] : types)
        EXPECT_EQ(MxReportingMessageTypeName(code), name) << code;
}

TEST(MxReportingVocabularyTest, HostApplicationFallsBackToUnknown)
{
    Dictionary withHost{{"HostApplicationDisplayID", 17}};
    Dictionary without{{"other", "x"}};
    EXPECT_EQ(MxReportingHostApplicationID(&withHost), Value(17)) << "returned as stored";
    EXPECT_EQ(MxReportingHostApplicationID(&without), Value("Unknown"));
    EXPECT_EQ(MxReportingHostApplicationID(nullptr), Value("Unknown"));
}

TEST(MxReportingVocabularyTest, InternalBuildIsAskedOnceHoweverManyThreadsAsk)
{
    FakePlatform platform;
    platform.device.setBool("InternalBuild", true);
    std::vector<std::thread> threads;
    std::atomic<int> internal{0};
    threads.reserve(8);
    for (int i = 0; i < 8; ++i)
        threads.emplace_back([&] { internal += MxReportingInternalBuild() ? 1 : 0; });
    for (auto& thread : threads)
        thread.join();
    platform.device.setBool("InternalBuild", false);
    EXPECT_TRUE(MxReportingInternalBuild()) << "never re-read";
    EXPECT_EQ(internal, 8);
    EXPECT_EQ(platform.device.queries(), 1);
}

} // namespace
} // namespace mx::testing
