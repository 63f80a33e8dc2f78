#include "Statistics/MxReportingVocabulary.h"

#include <thread>

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

struct NameCase {
    std::uint32_t code;
    const char* name;
};

void PrintTo(const NameCase& nameCase, std::ostream* out) { *out << nameCase.code << " -> " << nameCase.name; }

std::string caseName(const ::testing::TestParamInfo<NameCase>& info)
{
    return fmt::format("Code{:X}", info.param.code);
}

class ServiceTypeNameTest : public ::testing::TestWithParam<NameCase> {};
TEST_P(ServiceTypeNameTest, Names)
{
    EXPECT_EQ(MxReportingServiceTypeName(static_cast<ServiceType>(GetParam().code)), GetParam().name);
}
INSTANTIATE_TEST_SUITE_P(Codes, ServiceTypeNameTest,
                         ::testing::Values(NameCase{0, "generic"}, NameCase{2, "telephony"},
                                           NameCase{7, "longformaudio"}, NameCase{11, "test"}, NameCase{12, "apiusage"},
                                           NameCase{13, "telephony"}, NameCase{100, "telephony"},
                                           NameCase{65534, "telephony"}, NameCase{65535, "unknown"}),
                         caseName);

class CategoryNameTest : public ::testing::TestWithParam<NameCase> {};
TEST_P(CategoryNameTest, Names) { EXPECT_EQ(MxReportingCategoryName(GetParam().code), GetParam().name); }
INSTANTIATE_TEST_SUITE_P(Codes, CategoryNameTest,
                         ::testing::Values(NameCase{0x00000003, "Playback"}, NameCase{0x10000008, "DSP_Error"},
                                           NameCase{0x30000002, "_Record"}, NameCase{0xFFFFFFFF, "Undefined"},
                                           NameCase{0x80000000, "Toolbox_Undefined"}, NameCase{0, "Undefined"},
                                           NameCase{12, "Undefined"}, NameCase{0x0000FFFF, "Undefined"},
                                           NameCase{0x40000007, "Routing_RouteChange"},
                                           NameCase{0x0800000B, "Session_Volume"},
                                           NameCase{0x2000000A, "HAL_Performance"}),
                         caseName);

class MessageTypeNameTest : public ::testing::TestWithParam<NameCase> {};
TEST_P(MessageTypeNameTest, Names)
{
    EXPECT_EQ(MxReportingMessageTypeName(static_cast<MessageType>(GetParam().code)), GetParam().name);
}
INSTANTIATE_TEST_SUITE_P(Codes, MessageTypeNameTest,
                         ::testing::Values(NameCase{0, "Generic"}, NameCase{5, "IssueDetector"},
                                           NameCase{6, "Undefined"}, NameCase{65535, "Unknown"}),
                         caseName);

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
