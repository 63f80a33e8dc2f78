#include "Statistics/Service/MxReportingSession.h"

#include <algorithm>
#include <cmath>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"

namespace mx::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class MxReportingSessionTest : public ::testing::Test {
protected:
    std::shared_ptr<MxReportingSession> makeSession(ReporterID id = 5, ServiceType type = 7)
    {
        auto session = std::make_shared<MxReportingSession>(id, std::vector<std::int32_t>{42});
        if (type != service_type::kUnknown)
            session->setServiceType(type);
        return session;
    }

    void run() { platform.dispatch.runUntilIdle(); }

    static std::vector<std::string> identifiers(const MxReportingSession& session)
    {
        std::vector<std::string> ids;
        for (const auto& entry : session.nestedAggregatedPayloadData()->snapshot())
            ids.push_back(entry.asDictionary()->begin()->first);
        return ids;
    }

    std::shared_ptr<FakeUplinkSession> onlyBackendSession()
    {
        auto sessions = platform.uplink.sessions();
        EXPECT_EQ(sessions.size(), 1u);
        return sessions.empty() ? nullptr : sessions.front();
    }

    FakePlatform platform;
};

TEST_F(MxReportingSessionTest, OnlyAFirstStartAndAStartedStopDoAnythingAndTheLastReferenceStopsNothing)
{
    auto session = makeSession();
    session->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    run();
    platform.trace.clear();
    session->stop();
    EXPECT_THAT(platform.trace.codes(), IsEmpty()) << "a stop that stops nothing leaves no trace";
    EXPECT_NE(session->aggregatedPayloadData(), nullptr) << "and keeps the store";

    session->start();
    session->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    session->start();
    run();
    EXPECT_TRUE(platform.log.contains("5 is already started"));
    EXPECT_EQ(session->aggregatedPayloadData()->snapshot().size(), 1u);
    EXPECT_EQ(platform.uplink.tokensIssued(), 1) << "no second backend session";

    platform.trace.clear();
    session.reset();
    EXPECT_THAT(platform.trace.codes(), ElementsAre(0x21042834));
    EXPECT_TRUE(platform.log.contains("deallocing this session 5"));
    EXPECT_EQ(onlyBackendSession()->flushes(), 0);
    EXPECT_FALSE(platform.log.contains("sending summary event for reporter 5"));
}

TEST_F(MxReportingSessionTest, IdentifiersCountOnAcrossRestartsWhileStoresStartAfresh)
{
    auto session = makeSession();
    session->sendMessage(Dictionary{{"early", 1}}, 3, 1, nullptr);
    session->start();
    EXPECT_TRUE(session->aggregatedPayloadData()->snapshot().empty()) << "start drops what came before";
    session->sendMessage(Dictionary{}, 3, 1, nullptr);
    session->sendMessage(Dictionary{}, 3, 1, nullptr);
    session->sendMessage(Dictionary{}, 3, 2, nullptr);
    session->sendMessage(Dictionary{}, 0xFFFFFFFF, 7, nullptr);
    EXPECT_THAT(identifiers(*session),
                ElementsAre("Playback_Start_2", "Playback_Start_3", "Playback_Stop_1", "Undefined_Undefined_1"));

    session->stop();
    EXPECT_EQ(session->aggregatedPayloadData(), nullptr);
    EXPECT_EQ(session->nestedAggregatedPayloadData(), nullptr);
    session->sendMessage(Dictionary{{"late", 1}}, 3, 1, nullptr);
    session->start();
    session->sendMessage(Dictionary{}, 3, 1, nullptr);
    EXPECT_THAT(identifiers(*session), ElementsAre("Playback_Start_5"));
    EXPECT_EQ(session->messageTypeCounts().at("Undefined_Unknown"), 1) << "the summary event was counted";
}

TEST_F(MxReportingSessionTest, KeysAreCleanedAtTheTopLevelOnly)
{
    Dictionary nested{{"inner key", 1}};
    Dictionary cleaned =
        MxReportingCleanKeys(Dictionary{{"peak level", 3}, {"rate", 48000}, {"a  b", nested}, {"x y", 1}, {"x_y", 2}});
    EXPECT_EQ(cleaned, (Dictionary{{"peak_level", 3}, {"rate", 48000}, {"a__b", nested}, {"x_y", 2}}));

    auto session = makeSession();
    session->start();
    session->sendMessage(Dictionary{{"peak level", 3}}, 3, 1, nullptr);
    EXPECT_EQ(session->aggregatedPayloadData()->snapshot()[0], Value(Dictionary{{"peak_level", 3}}));

    // Kept encoded and read back: a payload nested almost as deep as a request may be,
    // every kind of value, and one level deeper again under its identifier.
    Value deepest = Dictionary{{"when", Date(std::chrono::seconds(1'800'000'000))},
                               {"raw", Data{1, 2}},
                               {"big", std::numeric_limits<std::uint64_t>::max()},
                               {"level", -3.5}};
    for (int depth = 2; depth < 60; ++depth)
        deepest = Array({deepest});
    session->sendMessage(Dictionary{{"deep", deepest}}, 3, 1, nullptr);
    EXPECT_EQ(session->aggregatedPayloadData()->snapshot()[1], Value(Dictionary{{"deep", deepest}}));
    EXPECT_EQ(session->nestedAggregatedPayloadData()->snapshot()[1],
              Value(Dictionary{{"Playback_Start_2", Dictionary{{"deep", deepest}}}}));
}

TEST_F(MxReportingSessionTest, BackendGetsSessionDescriptionAndMessagesInOrderThenTheFlush)
{
    auto session = makeSession(5, 12);
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "ExampleHost"}});
    bool replied = false;
    session->start();
    // Merged after start, before the configuration job runs: still reaches the backend.
    session->setConfiguration(Dictionary{{"ServiceName", "custom"}});
    session->sendMessage(Dictionary{{"rate", 48000}, {"route", "Speaker"}}, 0x08000003, 1,
                         [&](const std::optional<UplinkError>& error) { replied = !error; });
    EXPECT_TRUE(replied) << "the reply reports acceptance before delivery";
    session->sendMessage(Dictionary{{"rate", 44100}}, 0x08000003, 2, nullptr);
    session->stop();
    run();

    auto backend = onlyBackendSession();
    ASSERT_TRUE(backend);
    EXPECT_EQ(backend->sessionInfo,
              (Dictionary{{"ClientType", 19},
                          {"ClientVersion", 2.0},
                          {"SessionID", 5},
                          {"BatchEvent", false},
                          {"HierarchyToken", session->uplinkAgentToken()->text()},
                          {"ContainsRealtimeEvents", true}}));
    EXPECT_EQ(backend->userInfo,
              (Dictionary{{"ClientName", "com.kestrel.harmonia"},
                          {"ServiceName", "custom"},
                          {"HostApplicationDisplayID", "ExampleHost"}}));
    auto messages = backend->messages();
    ASSERT_EQ(messages.size(), 3u);
    EXPECT_EQ(messages[0].category, 3) << "the subsystem half is cut off";
    EXPECT_EQ(messages[1].type, 2);
    EXPECT_EQ(messages[2].category, 0xFFFF);
    EXPECT_EQ(messages[2].type, 0xFFFF);
    EXPECT_EQ(messages[2].payload,
              (Dictionary{{"Mx_Session_Summary_Event", "12"}, {"rate", "48000,44100"}, {"route", "Speaker"}}));
    EXPECT_EQ(backend->flushes(), 1);
    EXPECT_EQ(session->uplinkSession(), nullptr);
    EXPECT_TRUE(session->uplinkAgentToken()) << "the token is kept until the next start";
    EXPECT_FALSE(platform.log.contains("waiting for uplinkd to find backends")) << "backends were already known";
}

TEST_F(MxReportingSessionTest, BatchSessionOfUnsetTypeIsNamedUnknownAndItsFlushErrorIsLogged)
{
    platform.uplink.setFlushError(UplinkError{5, "collector unreachable"});
    auto session = makeSession(8, service_type::kUnknown);
    session->start();
    session->stop();
    run();
    auto backend = onlyBackendSession();
    ASSERT_TRUE(backend);
    EXPECT_EQ(*backend->sessionInfo.find("BatchEvent"), Value(true));
    EXPECT_EQ(*backend->sessionInfo.find("ContainsRealtimeEvents"), Value(false));
    EXPECT_EQ(*backend->userInfo.find("ServiceName"), Value("unknown_session"));
    EXPECT_TRUE(platform.log.contains("flush error collector unreachable"));
}

TEST_F(MxReportingSessionTest, TestSessionsAggregateButNeverTouchTheBackend)
{
    auto session = makeSession(5, service_type::kTest);
    session->start();
    session->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    session->sendMessage(Dictionary{{"a", 2}}, 3, 1, nullptr);
    session->stop();
    run();
    EXPECT_TRUE(platform.uplink.sessions().empty());
    EXPECT_EQ(platform.uplink.tokensIssued(), 0);
    EXPECT_EQ(platform.log.count("transactions aren't allowed on this platform"), 3u) << "two messages and the summary";
    EXPECT_EQ(session->messageTypeCounts().at("Playback_Start"), 2);
}

TEST_F(MxReportingSessionTest, MessagesOutsideAStartedPeriodGoOutAsSingleMessages)
{
    auto session = makeSession(5, service_type::kAlarms);
    session->sendMessage(Dictionary{{"a b", 1}}, 0x20000001, 4, nullptr);
    run();
    // Alarms wait out a random delay of 0 to 59 seconds: never longer.
    platform.dispatch.advance(std::chrono::seconds(59));
    run();
    auto oneShots = platform.uplink.oneShots();
    ASSERT_EQ(oneShots.size(), 1u);
    EXPECT_EQ(oneShots[0].category, 1);
    EXPECT_EQ(oneShots[0].payload, (Dictionary{{"a_b", 1}}));
    EXPECT_EQ(oneShots[0].userInfo, (Dictionary{{"ClientName", "com.kestrel.harmonia"}, {"ServiceName", "alarms"}}));
    EXPECT_EQ(oneShots[0].sessionInfo, (Dictionary{{"ClientType", 19}, {"ClientVersion", 2.0}, {"SessionID", -1}}));
}

TEST_F(MxReportingSessionTest, SingleMessageReportsTheBackendsRefusal)
{
    platform.uplink.setOneShotResult(false, UplinkError{7, "refused"});
    std::vector<std::optional<UplinkError>> replies;
    MxReportingSession::sendSingleMessage(Dictionary{}, 1, 0, service_type::kStandalone, nullptr,
                                          [&](const std::optional<UplinkError>& error) { replies.push_back(error); });
    run();
    platform.uplink.setOneShotResult(false, std::nullopt);
    MxReportingSession::sendSingleMessage(Dictionary{}, 1, 0, service_type::kStandalone, nullptr,
                                          [&](const std::optional<UplinkError>& error) { replies.push_back(error); });
    run();
    ASSERT_EQ(replies.size(), 2u);
    EXPECT_EQ(replies[0]->description, "refused");
    EXPECT_FALSE(replies[1]) << "a refusal without an error replies nothing and logs nothing";
    EXPECT_EQ(platform.log.texts(MxLogLevel::Error), std::vector<std::string>{"sendOneMessageWithSessionInfo refused"});
}

TEST_F(MxReportingSessionTest, FailedDiscoveryDropsTheBackendSessionAfterNineSecondsHoldingNoThread)
{
    platform.uplink.setDiscovery(FakeUplink::Discovery::NoBackends);
    auto session = makeSession();
    session->start();
    session->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    run();
    EXPECT_THAT(platform.log.texts(MxLogLevel::Error),
                ElementsAre("No backends found, this session won't get sent to the server"));
    platform.dispatch.advance(std::chrono::milliseconds(8999));
    run();
    EXPECT_NE(session->uplinkSession(), nullptr) << "still waiting";
    platform.dispatch.advance(std::chrono::milliseconds(1));
    run();
    EXPECT_THAT(platform.log.texts(MxLogLevel::Error),
                ElementsAre("No backends found, this session won't get sent to the server", "failed to find backend",
                            "No valid UplinkSession"));
    EXPECT_EQ(session->uplinkSession(), nullptr);
    EXPECT_TRUE(session->started()) << "the session keeps collecting";
    EXPECT_EQ(platform.dispatch.blockingCalls(), 0) << "the wait holds the session's queue, no thread";
    auto lines = platform.log.lines();
    auto waiting = std::find_if(lines.begin(), lines.end(),
                                [](const auto& line) { return line.text == "waiting for uplinkd to find backends"; });
    ASSERT_NE(waiting, lines.end());
    EXPECT_EQ(waiting->function, "MxReportingUtilityWait");
}

TEST_F(MxReportingSessionTest, DiscoveryAnsweredDuringTheWaitContinuesWithTheBackend)
{
    platform.uplink.setDiscovery(FakeUplink::Discovery::Held);
    auto session = makeSession();
    session->start();
    session->sendMessage(Dictionary{{"a", 1}}, 3, 1, nullptr);
    run();
    ASSERT_TRUE(platform.uplink.sessions().front()->answerDiscovery(std::vector<std::string>{"spool", "collector"}));
    run();
    EXPECT_THAT(platform.log.texts(MxLogLevel::Default),
                ElementsAre("waiting for uplinkd to find backends", "List of backends [\"spool\",\"collector\"]",
                            "continuing"));
    EXPECT_EQ(onlyBackendSession()->messages().size(), 1u);
    EXPECT_NE(session->uplinkSession(), nullptr);
    EXPECT_FALSE(session->uplinkSessionStarted()) << "nothing ever sets the seed";
}

// Everything a session gives its backend side runs in the order it was given, however
// long a discovery takes: a report of the next period never reaches the previous
// period's backend session, nor comes before its flush.
TEST_F(MxReportingSessionTest, ReportsOfAPeriodReachItsOwnBackendSessionInOrderAcrossASlowDiscovery)
{
    platform.uplink.setDiscovery(FakeUplink::Discovery::Held);
    auto session = makeSession();
    session->start();
    run();
    session->sendMessage(Dictionary{{"m", 1}}, 3, 1, nullptr);
    platform.dispatch.advance(std::chrono::seconds(1));
    run();
    session->stop();
    session->start();
    session->sendMessage(Dictionary{{"m", 6}}, 3, 1, nullptr);
    run();
    platform.uplink.setDiscovery(FakeUplink::Discovery::Backends);
    ASSERT_TRUE(platform.uplink.sessions().front()->answerDiscovery(std::vector<std::string>{"spool"}));
    run();

    auto backends = platform.uplink.sessions();
    ASSERT_EQ(backends.size(), 2u);
    auto payloads = [](const FakeUplinkSession& backend) {
        std::vector<Dictionary> sent;
        for (const auto& message : backend.messages())
            sent.push_back(message.payload);
        return sent;
    };
    EXPECT_THAT(payloads(*backends[0]),
                ElementsAre(Dictionary{{"m", 1}}, Dictionary{{"Mx_Session_Summary_Event", "7"}, {"m", "1"}}));
    EXPECT_EQ(backends[0]->flushes(), 1);
    EXPECT_THAT(payloads(*backends[1]), ElementsAre(Dictionary{{"m", 6}}));
    EXPECT_EQ(backends[1]->flushes(), 0);
}

class MxReportingSessionOrientationTest : public MxReportingSessionTest {
protected:
    MxReportingSessionOrientationTest() { platform.device.setBool("InternalBuild", true); }

    std::vector<std::string> orientationEffects() const
    {
        std::vector<std::string> effects;
        for (const auto& effect : platform.journal.effects())
            if (effect.starts_with("orientation "))
                effects.push_back(effect);
        return effects;
    }

    // The orientation records in a store (the session's current one by default).
    static std::vector<Dictionary> records(const MxReportingSession& session)
    {
        return records(session.aggregatedPayloadData()->snapshot());
    }
    static std::vector<Dictionary> records(const Array& store)
    {
        std::vector<Dictionary> found;
        for (const auto& entry : store)
            if (const Dictionary* record = entry.asDictionary();
                record && record->size() == 2 && (record->find("device_orientation") || record->find("ui_orientation")))
                found.push_back(*record);
        return found;
    }
};

TEST_F(MxReportingSessionOrientationTest, OnlyLongFormAudioAndTelephonyOffClassSixOfAnInternalBuildAreTracked)
{
    struct Case {
        bool internal;
        ServiceType type;
        std::int64_t deviceClass;
        bool tracked;
    };
    for (auto [internal, type, deviceClass, tracked] :
         {Case{true, 7, 0, true}, Case{true, 2, 1, true}, Case{true, 1, 0, false}, Case{true, 7, 6, false},
          Case{false, 7, 0, false}}) {
        SCOPED_TRACE(fmt::format("internal {} type {} class {}", internal, type, deviceClass));
        MxReportingResetInternalBuildForTesting();
        platform.device.setBool("InternalBuild", internal);
        platform.device.setInteger("DeviceClassNumber", deviceClass);
        platform.journal.clear();
        auto session = makeSession(42, type);
        session->start();
        EXPECT_EQ(session->orientationCallbackID(),
                  tracked ? std::optional<std::string>("MxReportingService 42") : std::nullopt);
        session->stop();
        session->stop();
        if (tracked)
            EXPECT_THAT(orientationEffects(),
                        ElementsAre("orientation register device MxReportingService 42",
                                    "orientation register ui MxReportingService 42",
                                    "orientation unregister device MxReportingService 42",
                                    "orientation unregister ui MxReportingService 42"));
        else
            EXPECT_THAT(orientationEffects(), IsEmpty());
        EXPECT_EQ(session->orientationCallbackID(), std::nullopt);
    }
}

TEST_F(MxReportingSessionOrientationTest, RecordsGoIntoTheSummaryEventOnlyWhileStartedTimedFromTheStart)
{
    auto session = makeSession(5, 2);
    session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "Dialer"}});
    platform.orientation.change("device", 3);
    EXPECT_THAT(orientationEffects(), IsEmpty()) << "nothing is registered before a start";
    session->start();
    session->sendMessage(Dictionary{{"rate", 48000}}, 3, 1, nullptr);
    platform.orientation.change("device", 3);
    platform.orientation.change("ui", 1);

    auto found = records(*session);
    ASSERT_EQ(found.size(), 2u);
    EXPECT_EQ(found[0].find("device_orientation")->description(), "orientation-3");
    EXPECT_EQ(found[1].find("ui_orientation")->description(), "orientation-1");
    double seconds = found[0].find("device_orientation_time")->doubleValue();
    EXPECT_GE(seconds, 0.0);
    EXPECT_LT(seconds, 10.0);
    EXPECT_EQ(std::round(seconds * 1000) / 1000, seconds) << "rounded to the millisecond";
    EXPECT_THAT(identifiers(*session), ElementsAre("Playback_Start_1")) << "records are no file entries";

    session->stop();
    run();
    auto summary = onlyBackendSession()->messages().back().payload;
    EXPECT_EQ(summary.find("device_orientation")->description(), "orientation-3");
    EXPECT_EQ(summary.find("ui_orientation")->description(), "orientation-1");
    EXPECT_EQ(summary.find("rate")->description(), "48000");
    EXPECT_EQ(platform.orientation.registrations(), 0u) << "the callbacks no longer hold the session";
}

TEST_F(MxReportingSessionOrientationTest, ASessionRetypedWhileStartedStaysRegisteredAndRecordsIntoItsNextPeriod)
{
    auto session = makeSession(5, 7);
    session->start();
    session->setServiceType(1);
    session->stop();
    EXPECT_EQ(session->orientationCallbackID(), std::optional<std::string>("MxReportingService 5"));
    platform.orientation.change("device", 4);
    EXPECT_EQ(session->aggregatedPayloadData(), nullptr) << "the record between periods is lost";
    session->start();
    platform.orientation.change("device", 4);
    EXPECT_EQ(records(*session).size(), 1u);
}

TEST_F(MxReportingSessionOrientationTest, APeriodRecordsEveryChangeAFewBytesEach)
{
    auto session = makeSession(5, 7);
    session->start();
    constexpr int kChanges = 20000;
    for (int i = 0; i < kChanges; ++i)
        platform.orientation.change(i % 2 ? "device" : "ui", i % 7);
    EXPECT_EQ(records(*session).size(), std::size_t(kChanges));
    EXPECT_LT(session->aggregatedPayloadData()->arena()->keptBytes(), std::size_t(kChanges) * 64);
    session->stop();
    session->start();
    platform.orientation.change("device", 1);
    EXPECT_EQ(records(*session).size(), 1u) << "a new period records anew";
}

TEST_F(MxReportingSessionOrientationTest, ChangesRacingStopsNeverReachADroppedStoreAndNoneWhileStartedIsLost)
{
    auto session = makeSession(5, 7);
    std::atomic<bool> done{false};
    // Paced, so that a period never reaches its bound of records.
    std::thread toolbox([&] {
        while (!done.load()) {
            platform.orientation.change("ui", 2);
            std::this_thread::sleep_for(std::chrono::microseconds(1));
        }
    });
    for (int period = 0; period < 200 && !HasFailure(); ++period) {
        session->start();
        auto store = session->aggregatedPayloadData();
        platform.orientation.change("device", 1);
        session->stop();
        auto kept = records(store->snapshot());
        EXPECT_EQ(std::count_if(kept.begin(), kept.end(),
                                [](const Dictionary& record) { return record.find("device_orientation"); }),
                  1)
            << "period " << period;
        platform.orientation.change("ui", 2);
        EXPECT_EQ(records(store->snapshot()).size(), kept.size()) << "nothing lands in a dropped store";
    }
    done.store(true);
    toolbox.join();
}

} // namespace
} // namespace mx::testing
