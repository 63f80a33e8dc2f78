#include "Statistics/Service/MxReportingSessionSummary.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "Statistics/Service/MxReportingSession.h"
#include "fakes/FakePlatform.h"
#include "value/JsonValue.h"

namespace mx::testing {
namespace {

class MxReportingSessionSummaryTest : public ::testing::Test {
protected:
    void SetUp() override { platform.device.setBool("InternalBuild", true); }

    std::shared_ptr<MxReportingSession> makeSession(ReporterID id = 5, ServiceType type = 7)
    {
        auto session = std::make_shared<MxReportingSession>(id, std::vector<std::int32_t>{42});
        session->setServiceType(type);
        return session;
    }

    std::pair<std::string, nlohmann::json> onlyFile()
    {
        EXPECT_EQ(platform.files.files.size(), 1u);
        if (platform.files.files.empty())
            return {};
        auto& [path, text] = *platform.files.files.begin();
        return {path.string(), nlohmann::json::parse(text)};
    }

    static constexpr const char* kDirectory = "/root/var/log/harmonia/reporting";
    FakePlatform platform;
};

TEST_F(MxReportingSessionSummaryTest, SummaryEventListsEveryValueOfEveryKeyInMessageOrder)
{
    auto session = makeSession();
    EXPECT_FALSE(session->createSummaryEventForSession()) << "nothing aggregated, no summary";
    session->start();
    EXPECT_FALSE(session->createSummaryEventForSession());
    session->sendMessage(Dictionary{{"rate", 48000}, {"output route", "Speaker"}}, 3, 1, nullptr);
    session->sendMessage(Dictionary{{"rate", 44100}, {"list", Array{1, "two"}}, {"Mx_Session_Summary_Event", "x"}}, 3,
                         1, nullptr);
    EXPECT_EQ(*session->createSummaryEventForSession(),
              (Dictionary{{"Mx_Session_Summary_Event", "7,x"},
                          {"rate", "48000,44100"},
                          {"output_route", "Speaker"},
                          {"list", "[1,\"two\"]"}}));

    // Every kind of value reads as its description, inside containers and out.
    using namespace std::chrono;
    Date date(seconds(1700000000) + milliseconds(250));
    Dictionary everyKind{
        {"nested",
         Dictionary{{"k",
                     Array{Value(), true, 0, 9, 10, 99, 100, 127, -3, -32, -33, 18446744073709551615ull, 0.1,
                           Data{0x0a, 0xff}, date, "q\"\n\x01", Array{}, Dictionary{}}}}},
        {"when", date},
        {"bytes", Data{0x00, 0x7f}},
        {"negative", -5},
        {"small", 2.5e-7},
        {"single", 1.5f},
        {"nothing", Value()},
        {"yes", false}};
    session->sendMessage(everyKind, 3, 1, nullptr);
    auto summary = *session->createSummaryEventForSession();
    for (const auto& [key, value] : everyKind)
        EXPECT_EQ(*summary.find(key), Value(value.description())) << key;
    session->stop();
    EXPECT_TRUE(platform.log.contains("sending summary event for reporter 5"));
}

TEST_F(MxReportingSessionSummaryTest, FileHoldsUserInfoThenEveryMessageThenTheSummary)
{
    auto session = makeSession(5, 7);
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "ExampleHost"}});
    session->start();
    session->sendMessage(Dictionary{{"output route", "Speaker"}, {"rate", 48000}}, 0x08000003, 1, nullptr);
    session->sendMessage(Dictionary{{"rate", 44100}}, 0x08000003, 2, nullptr);
    session->stop();

    EXPECT_EQ(platform.files.directories.at(kDirectory), 0777);
    auto [path, document] = onlyFile();
    EXPECT_THAT(path,
                ::testing::MatchesRegex(std::string(kDirectory) +
                                        "/[0-9]{8}-[0-9]{6}[-+][0-9]{4}-harmonia-ExampleHost-longformaudio\\.json"));
    EXPECT_EQ(document, nlohmann::json::parse(R"([
        {"HostApplicationDisplayID": "ExampleHost"},
        {"Session_Playback_Start_1": {"output_route": "Speaker", "rate": 48000}},
        {"Session_Playback_Stop_1": {"rate": 44100}},
        {"Undefined_Unknown_1": {"Mx_Session_Summary_Event": "7", "output_route": "Speaker", "rate": "48000,44100"}}
    ])"));
}

TEST_F(MxReportingSessionSummaryTest, FileIsTheJsonLibrarysOwnPrettyPrintOfEveryKindOfValue)
{
    using namespace std::chrono;
    auto session = makeSession(5, 7);
    session->start();
    Dictionary everyKind{{"nested",
                          Dictionary{{"k",
                                      Array{Value(), true, 0, 99, 127, -3, -33, 18446744073709551615ull, 0.1, 1.0,
                                            1e300, std::nan(""), Data{0x0a, 0xff, 0x00}, Date(seconds(1700000000)),
                                            "q\"\n\x01\x7f", Array{}, Dictionary{}, Array{Array{1}}}}}},
                         {"single", 1.5f}};
    session->sendMessage(everyKind, 0x08000003, 1, nullptr);
    session->stop();

    ASSERT_EQ(platform.files.files.size(), 1u);
    const std::string& text = platform.files.files.begin()->second;
    auto document = nlohmann::ordered_json::parse(text);
    EXPECT_EQ(text, document.dump(4));
    EXPECT_EQ(document[1]["Session_Playback_Start_1"], toJson(everyKind));
}

TEST_F(MxReportingSessionSummaryTest, HostNamesNeverLeaveTheDirectoryAndUnnamedHostsAreUnknown)
{
    auto session = makeSession(5, 2);
    EXPECT_THAT(session->summaryFileName(0), ::testing::EndsWith("-harmonia-unknown-telephony.json"));
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "../../etc/passwd"}});
    auto name = session->summaryFileName(0);
    EXPECT_EQ(name.find('/'), std::string::npos);
    EXPECT_THAT(name, ::testing::EndsWith("-harmonia-.._.._etc_passwd-telephony.json"));
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "a\nb\x7f\u202Egpj.exe\u2066c"}});
    EXPECT_THAT(session->summaryFileName(0), ::testing::EndsWith("-harmonia-a_b__gpj.exe_c-telephony.json"));
}

TEST_F(MxReportingSessionSummaryTest, NothingIsWrittenWithoutMessagesOrOnCustomerBuilds)
{
    auto quiet = makeSession(5, 7);
    quiet->start();
    quiet->stop();
    EXPECT_TRUE(platform.files.files.empty());

    MxReportingResetInternalBuildForTesting();
    platform.device.setBool("InternalBuild", false);
    auto customer = makeSession(6, 7);
    customer->start();
    customer->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    customer->stop();
    EXPECT_TRUE(platform.files.files.empty());
    EXPECT_TRUE(platform.log.contains("sending summary event for reporter 6")) << "the summary event still goes out";
}

TEST_F(MxReportingSessionSummaryTest, UnwritableDirectoryIsLoggedTwiceAndStopGoesOn)
{
    platform.files.directoryFailure = "Permission denied";
    auto session = makeSession(5, 7);
    session->start();
    session->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    session->stop();
    platform.dispatch.runUntilIdle();
    EXPECT_THAT(
        platform.log.texts(MxLogLevel::Error),
        ::testing::ElementsAre(std::string("can't create logging directory at ") + kDirectory + ": Permission denied",
                               "jsonOutput writeToURL: No such file or directory"));
    EXPECT_EQ(platform.uplink.sessions().front()->flushes(), 1);
}

} // namespace
} // namespace mx::testing
