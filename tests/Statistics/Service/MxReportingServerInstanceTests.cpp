#include "Statistics/Service/MxReportingServerInstance.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"
#include "fakes/ServiceHostHarness.h"

namespace mx::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

template <class T>
struct Replies {
    std::vector<T> values;
    auto callback()
    {
        return [this](T value) {
            values.push_back(std::move(value));
        };
    }
};

class MxReportingServerInstanceTest : public ::testing::Test {
protected:
    MxReportingServerInstanceTest()
    {
        host.chanstat.groups[{"Speaker", std::nullopt}] = {ChanstatChannel{"underruns", "Speaker/underruns", 0}};
        host.start();
    }

    std::shared_ptr<MxReportingServerInstance> connect(std::int32_t pid) { return host.connect(pid); }

    void run() { platform.dispatch.runUntilIdle(); }

    bool create(MxReportingServerInstance& client, ReporterID id)
    {
        Replies<bool> replies;
        client.createReportingSession(id, replies.callback());
        run();
        return replies.values == std::vector<bool>{true};
    }

    std::vector<bool> stop(MxReportingServerInstance& client, ReporterID id, Replies<bool>& order)
    {
        client.stopReportingSessionForID(id, order.callback());
        run();
        return order.values;
    }

    std::shared_ptr<MxReportingSession> session(MxReportingServerInstance& client, ReporterID id)
    {
        auto found = client.clientReportingSessionMap().find(id);
        return found == client.clientReportingSessionMap().end() ? nullptr : found->second;
    }

    std::optional<MxReportingError> send(MxReportingServerInstance& client, Dictionary payload,
                                         std::optional<Array> ids, MessageCategory category = 0x08000003,
                                         MessageType type = 1)
    {
        Replies<std::optional<MxReportingError>> replies;
        client.sendMessage(std::move(payload), category, type, std::move(ids), replies.callback());
        run();
        EXPECT_EQ(replies.values.size(), 1u);
        return replies.values.empty() ? std::nullopt : replies.values.front();
    }

    std::vector<std::string> tallyNames() const
    {
        std::vector<std::string> names;
        for (const auto& event : platform.tally.events())
            names.push_back(event.name);
        return names;
    }

    FakePlatform platform;
    ServiceHostHarness host{[this] {
        run();
    }};
};

TEST_F(MxReportingServerInstanceTest, SessionLifeAsAClientDrivesIt)
{
    auto client = connect(42);
    ASSERT_TRUE(create(*client, 5));
    EXPECT_TRUE(platform.log.contains("session created for reporter 5"));

    Replies<bool> typed, configured, started;
    client->setServiceType(7, 5, typed.callback());
    client->setConfiguration(Dictionary{{"HostApplicationDisplayID", "ExampleHost"}}, 5, configured.callback());
    client->startReportingSessionForID(5, started.callback());
    run();
    EXPECT_THAT(typed.values, ElementsAre(true));
    EXPECT_THAT(configured.values, ElementsAre(true));
    EXPECT_THAT(started.values, IsEmpty()) << "the start reply is held until the session stops";
    EXPECT_TRUE(platform.log.contains("service type 7 set for reporter  5"));
    auto reporting = session(*client, 5);
    EXPECT_TRUE(reporting->started());
    EXPECT_EQ(reporting->serviceName(), "longformaudio");
    auto snapShot = reporting->driverSnapShot();
    ASSERT_NE(snapShot, nullptr);
    EXPECT_EQ(snapShot->count("Speaker-(null)"), 1u) << "the drivers are sampled at the start";

    EXPECT_EQ(send(*client, Dictionary{{"rate", 48000}, {"EngineOnTime", 2.5}}, Array{5}), std::nullopt);
    ASSERT_EQ(platform.tally.events().size(), 1u);
    EXPECT_EQ(platform.tally.events()[0].name, "com.kestrel.harmonia.Session_Playback.Start");
    EXPECT_EQ(*platform.tally.events()[0].payload.find("HostApplicationDisplayID"), Value("ExampleHost"));
    EXPECT_EQ(platform.joule.events().size(), 1u);

    host.chanstat.values["Speaker/underruns"] = 3;
    Replies<bool> order;
    client->stopReportingSessionForID(5, [&](bool value) {
        EXPECT_THAT(started.values, ElementsAre(true)) << "the held start reply comes before the stop reply";
        order.values.push_back(value);
    });
    run();
    EXPECT_THAT(order.values, ElementsAre(true));
    EXPECT_THAT(started.values, ElementsAre(true));
    EXPECT_FALSE(reporting->started());
    EXPECT_EQ(reporting->driverSnapShot(), nullptr);
    EXPECT_THAT(tallyNames(),
                ElementsAre("com.kestrel.harmonia.Session_Playback.Start", "com.kestrel.harmonia.DriverStats.Generic"));
    EXPECT_EQ(platform.joule.events().size(), 1u) << "driver statistics never reach the power log";
    EXPECT_EQ(reporting->messageTypeCounts().at("DriverStats_Generic"), 1);
    EXPECT_TRUE(platform.log.contains("fetching driver logs {\"Speaker_underruns\":3}"));
    EXPECT_TRUE(platform.log.contains("stopping 5"));

    Replies<bool> destroyed;
    client->destroyReportingSession(5, destroyed.callback());
    reporting.reset();
    run();
    EXPECT_THAT(destroyed.values, ElementsAre(true));
    EXPECT_TRUE(client->clientReportingSessionMap().empty());
    EXPECT_TRUE(platform.log.contains("destroying 5"));
    EXPECT_TRUE(platform.log.contains("deallocing this session 5"));

    auto codes = platform.trace.codes();
    auto position = [&](std::uint32_t code) {
        return std::find(codes.begin(), codes.end(), code) - codes.begin();
    };
    EXPECT_LT(position(0x21042814), position(0x21042828)) << "create handled, then session created";
    EXPECT_LT(position(0x21042818), position(0x2104282C));
    EXPECT_LT(position(0x2104281C), position(0x21042830));
    EXPECT_LT(position(0x21042820), position(0x21042834));
}

TEST_F(MxReportingServerInstanceTest, HeldStartRepliesAreAnsweredOnceByTheOwnersStopOrTheNextStart)
{
    auto owner = connect(1);
    auto other = connect(2);
    create(*owner, 5);

    Replies<bool> started, repeated;
    other->startReportingSessionForID(5, started.callback());
    other->startReportingSessionForID(5, repeated.callback());
    run();
    auto reporting = session(*owner, 5);
    EXPECT_TRUE(reporting->started()) << "start looks across clients";
    EXPECT_THAT(repeated.values, ElementsAre(true)) << "a started session's start replies at once";
    EXPECT_EQ(platform.uplink.sessions().size(), 1u);

    Replies<bool> otherStop, otherDestroy;
    other->stopReportingSessionForID(5, otherStop.callback());
    other->destroyReportingSession(5, otherDestroy.callback());
    run();
    EXPECT_THAT(otherStop.values, ElementsAre(true));
    EXPECT_THAT(otherDestroy.values, ElementsAre(true));
    EXPECT_TRUE(reporting->started()) << "stop and destroy act on the caller's own sessions only";
    EXPECT_THAT(started.values, IsEmpty());

    // A stop that is not a stop request (as at a disconnection) leaves the held reply
    // in the session; the next start answers it before parking its own.
    host.root->serverQueue()->dispatch([&] { reporting->stop(); });
    Replies<bool> fresh;
    other->startReportingSessionForID(5, fresh.callback());
    run();
    EXPECT_THAT(started.values, ElementsAre(true));
    EXPECT_THAT(fresh.values, IsEmpty());

    Replies<bool> ownerStop;
    stop(*owner, 5, ownerStop);
    EXPECT_THAT(fresh.values, ElementsAre(true)) << "the other client's held start reply is answered";
    EXPECT_THAT(started.values, ElementsAre(true)) << "and only once";
    EXPECT_FALSE(reporting->hasTransactionCompleteBlock());
    EXPECT_TRUE(platform.log.contains("nothing interesting to fetch from the drivers"));
    EXPECT_TRUE(platform.tally.events().empty()) << "no driver grew: no statistics message";
}

TEST_F(MxReportingServerInstanceTest, ReporterZeroIsCreatedButNeverStartedFoundOrStopped)
{
    auto client = connect(1);
    ASSERT_TRUE(create(*client, 0));
    auto zero = session(*client, 0);
    ASSERT_NE(zero, nullptr);

    Replies<bool> typed, started, stopped, destroyed;
    Replies<ServiceType> serviceTypes;
    Replies<Dictionary> validity;
    client->setServiceType(7, 0, typed.callback());
    client->startReportingSessionForID(0, started.callback());
    client->getServiceNameForReporterID(0, serviceTypes.callback());
    client->reporterID(0, validity.callback());
    client->stopReportingSessionForID(0, stopped.callback());
    client->destroyReportingSession(0, destroyed.callback());
    run();

    EXPECT_THAT(typed.values, ElementsAre(true));
    EXPECT_THAT(started.values, ElementsAre(true));
    EXPECT_THAT(stopped.values, ElementsAre(true));
    EXPECT_THAT(destroyed.values, ElementsAre(true));
    EXPECT_THAT(serviceTypes.values, ElementsAre(65535, 65535)) << "reporter 0 is answered twice";
    EXPECT_THAT(validity.values, ElementsAre(Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
    EXPECT_FALSE(zero->started());
    EXPECT_EQ(zero->serviceType(), 65535);
    EXPECT_EQ(session(*client, 0), zero) << "destroy of reporter 0 does nothing";
    EXPECT_FALSE(platform.log.contains("stopping 0"));
    EXPECT_FALSE(platform.log.contains("destroying 0"));
    EXPECT_EQ(send(*client, Dictionary{{"a", 1}}, Array{0}), std::nullopt);
    EXPECT_TRUE(platform.tally.events().empty());

    Replies<std::vector<ReporterID>> reporters;
    client->getAllReporters(reporters.callback());
    run();
    EXPECT_THAT(reporters.values, ElementsAre(std::vector<ReporterID>{0}));
}

TEST_F(MxReportingServerInstanceTest, QueriesFindSessionsOfAnyClientInConnectionOrder)
{
    auto first = connect(1);
    auto second = connect(2);
    create(*second, 5);
    create(*second, 6);
    create(*first, 6);
    Replies<bool> typed;
    second->setServiceType(12, 5, typed.callback());
    first->setServiceType(3, 6, typed.callback());
    second->setServiceType(4, 6, typed.callback());

    Replies<ServiceType> serviceTypes;
    Replies<ServiceType> ownServiceType;
    Replies<Dictionary> validity;
    Replies<std::vector<ReporterID>> reporters;
    first->getServiceNameForReporterID(5, serviceTypes.callback());
    second->getServiceNameForReporterID(6, ownServiceType.callback());
    first->getServiceNameForReporterID(77, serviceTypes.callback());
    first->reporterID(5, validity.callback());
    first->reporterID(77, validity.callback());
    second->getAllReporters(reporters.callback());
    run();

    EXPECT_THAT(serviceTypes.values, ElementsAre(12, 65535));
    EXPECT_THAT(ownServiceType.values, ElementsAre(4)) << "own sessions come before other clients'";
    EXPECT_TRUE(platform.log.contains("found reporting session 5 for client 2"));
    EXPECT_TRUE(platform.log.contains("failed to find reporting session 77"));
    EXPECT_TRUE(platform.log.contains("returnning service type 12 for reporter  5"));
    EXPECT_THAT(validity.values,
                ElementsAre(Dictionary{{"reporterID", 5}, {"serviceType", 12}},
                            Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
    EXPECT_THAT(reporters.values, ElementsAre(std::vector<ReporterID>{6, 5, 6}));
    EXPECT_TRUE(platform.log.contains("validating reporter 5"));
}

TEST_F(MxReportingServerInstanceTest, MessageToAnIdListReachesSinksThenSessionInListOrder)
{
    auto first = connect(1);
    auto second = connect(2);
    create(*first, 5);
    create(*second, 6);
    platform.journal.clear();

    EXPECT_EQ(send(*first, Dictionary{{"EngineOnTime", 4}}, Array{6, 99, 5}, 3, 2), std::nullopt);
    EXPECT_THAT(platform.journal.effects(),
                ElementsAre("trace 0x21042824", "tally com.kestrel.harmonia.Playback.Stop", "joule Tessera_Haptics",
                            "trace 0x21042838", "tally com.kestrel.harmonia.Playback.Stop", "joule Tessera_Haptics",
                            "trace 0x21042838",
                            // neither session is started: each delivery goes out as a single message
                            "trace 0x21042838", "trace 0x21042838"));
    EXPECT_EQ(session(*second, 6)->messageTypeCounts().at("Playback_Stop"), 1);

    platform.journal.clear();
    EXPECT_EQ(send(*first, Dictionary{{"EngineOnTime", 4}}, Array{}), std::nullopt);
    EXPECT_THAT(platform.journal.effects(), ElementsAre("trace 0x21042824")) << "an empty list sends to nobody";
}

TEST_F(MxReportingServerInstanceTest, MessageWithoutIdListReachesEveryStartedSessionSessionFirst)
{
    auto first = connect(1);
    auto second = connect(2);
    create(*first, 5);
    create(*first, 7);
    create(*second, 6);
    Replies<bool> started;
    first->startReportingSessionForID(5, started.callback());
    second->startReportingSessionForID(6, started.callback());
    run();
    platform.journal.clear();

    EXPECT_EQ(send(*second, Dictionary{{"k", "v"}}, std::nullopt, 1, 0), std::nullopt);
    EXPECT_THAT(platform.journal.effects(),
                ElementsAre("trace 0x21042824", "trace 0x21042838", "tally com.kestrel.harmonia.Generic.Generic",
                            "trace 0x21042838", "tally com.kestrel.harmonia.Generic.Generic"));
    EXPECT_EQ(session(*first, 7)->messageTypeCounts().count("Generic_Generic"), 0u) << "not started";
    EXPECT_TRUE(platform.log.contains(
        "sessions for client 1 : (<MxReportingSession reporterID=5 serviceType=65535 started=YES>, "
        "<MxReportingSession reporterID=7 serviceType=65535 started=NO>)"));
    EXPECT_TRUE(platform.log.contains(
        "active reporting sessions 2 : (<MxReportingSession reporterID=5 serviceType=65535 started=YES>, "
        "<MxReportingSession reporterID=6 serviceType=65535 started=YES>)"));
    EXPECT_TRUE(platform.uplink.oneShots().empty());
}

// One serial queue, requests whole and in the order they came, whoever sent them: a
// stop's sampling is part of the stop, and a message to many sessions reaches them all
// before the next request runs.
TEST_F(MxReportingServerInstanceTest, EveryClientsRequestsRunWholeInTheOrderTheyArrived)
{
    auto owner = connect(1);
    auto other = connect(2);
    auto bystander = connect(3);
    for (ReporterID id = 1; id <= 2000; ++id) {
        owner->createReportingSession(id, [](bool) {});
        owner->startReportingSessionForID(id, [](bool) {});
    }
    run();
    std::vector<std::string> order;
    Replies<bool> restarted;
    std::size_t eventsBeforeBystander = 0;
    owner->stopReportingSessionForID(1, [&](bool) { order.emplace_back("stop"); });
    other->startReportingSessionForID(1, restarted.callback());
    owner->sendMessage(Dictionary{{"k", 1}}, 3, 1, std::nullopt, [&](auto) { order.emplace_back("broadcast"); });
    bystander->reporterID(1, [&](auto) {
        order.emplace_back("bystander");
        eventsBeforeBystander = platform.tally.events().size();
    });
    run();
    EXPECT_EQ(order.front(), "stop");
    EXPECT_EQ(eventsBeforeBystander, 2000u) << "the broadcast reached every session before the next request ran";
    EXPECT_THAT(order, ::testing::Contains("broadcast")) << "answered once its delivery to the restarted session ran";
    EXPECT_TRUE(session(*owner, 1)->started()) << "the other client's start came after the stop";
    EXPECT_THAT(restarted.values, IsEmpty()) << "its reply is held by the new period";
    EXPECT_EQ(platform.tally.events().size(), 2000u) << "every started session, the restarted one too";
}

TEST_F(MxReportingServerInstanceTest, ABroadcastsLogLinesNameEverySession)
{
    auto client = connect(1);
    for (ReporterID id = 1; id <= 40; ++id)
        create(*client, id);
    Replies<bool> started;
    client->startReportingSessionForID(40, started.callback());
    run();
    send(*client, Dictionary{{"k", "v"}}, std::nullopt);
    std::string listed;
    for (ReporterID id = 1; id <= 40; ++id)
        listed += fmt::format("{}<MxReportingSession reporterID={} serviceType=65535 started={}>", id > 1 ? ", " : "",
                              id, id == 40 ? "YES" : "NO");
    EXPECT_TRUE(platform.log.contains(fmt::format("sessions for client 1 : ({})", listed)));
    EXPECT_TRUE(platform.log.contains(
        "active reporting sessions 1 : (<MxReportingSession reporterID=40 serviceType=65535 started=YES>)"));
}

TEST_F(MxReportingServerInstanceTest, MessageWithoutIdListAndNoStartedSessionGoesOutOnceAlone)
{
    auto client = connect(1);
    create(*client, 5);
    EXPECT_EQ(send(*client, Dictionary{{"peak level", 3}}, std::nullopt, 0x20000001, 4), std::nullopt);

    EXPECT_TRUE(platform.log.contains("no active reporting sessions found, sending as standalone"));
    EXPECT_TRUE(platform.tally.events().empty());
    auto oneShots = platform.uplink.oneShots();
    ASSERT_EQ(oneShots.size(), 1u);
    EXPECT_EQ(oneShots[0].category, 1);
    EXPECT_EQ(oneShots[0].type, 4);
    EXPECT_EQ(oneShots[0].payload, (Dictionary{{"peak_level", 3}}));
    EXPECT_EQ(oneShots[0].userInfo,
              (Dictionary{{"ClientName", "com.kestrel.harmonia"}, {"ServiceName", "standalone"}}));
    EXPECT_EQ(*oneShots[0].sessionInfo.find("SessionID"), Value(-1));
}

TEST_F(MxReportingServerInstanceTest, ReportingSwitchedOffRefusesMessagesAndHidesOtherClients)
{
    auto owner = connect(1);
    auto other = connect(2);
    create(*owner, 5);
    host.setPreferences(Dictionary{{"disable_reporting", true}});

    auto error = send(*owner, Dictionary{{"a", 1}}, Array{5});
    ASSERT_TRUE(error);
    EXPECT_EQ(*error, (MxReportingError{"com.kestrel.audio.reporting", 1}));
    EXPECT_EQ(send(*owner, Dictionary{{"a", 1}}, std::nullopt), error);
    EXPECT_TRUE(platform.tally.events().empty());
    EXPECT_TRUE(platform.uplink.oneShots().empty());

    Replies<bool> otherStart;
    Replies<Dictionary> validity;
    other->startReportingSessionForID(5, otherStart.callback());
    other->reporterID(5, validity.callback());
    run();
    EXPECT_THAT(otherStart.values, ElementsAre(true));
    EXPECT_FALSE(session(*owner, 5)->started());
    EXPECT_THAT(validity.values, ElementsAre(Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));

    Replies<bool> ownStart;
    owner->startReportingSessionForID(5, ownStart.callback());
    run();
    EXPECT_TRUE(session(*owner, 5)->started()) << "own sessions still start while reporting is off";
}

TEST_F(MxReportingServerInstanceTest, DisconnectionStopsSessionsOnceAndNeverAnswersHeldReplies)
{
    auto client = connect(42);
    create(*client, 5);
    create(*client, 6);
    Replies<bool> started;
    client->startReportingSessionForID(5, started.callback());
    run();
    create(*client, 7);
    client->startReportingSessionForID(7, [](bool) {});
    run();
    host.chanstat.values["Speaker/underruns"] = 7; // grown since both starts
    client->destroyReportingSession(7, [](bool) {});
    run();
    platform.trace.clear();

    client->handleConnectionError();
    client->handleConnectionError();
    run();
    EXPECT_THAT(tallyNames(), IsEmpty()) << "neither a destroy nor a disconnection sends driver statistics";

    EXPECT_TRUE(host.clients().empty());
    EXPECT_EQ(platform.log.count("removing 42 from the server client list"), 1u);
    EXPECT_THAT(platform.trace.codes(), ElementsAre(0x21042830)) << "one started session stopped, once";
    EXPECT_THAT(started.values, IsEmpty());
    EXPECT_EQ(client->clientReportingSessionMap().size(), 2u) << "sessions stay with the instance";
    EXPECT_FALSE(session(*client, 5)->started());
}

TEST_F(MxReportingServerInstanceTest, EntryOnlyLogsAndQueuesAndAVanishedEndpointsRequestsAreDropped)
{
    // An endpoint the root does not hold: it goes when the test lets go of it.
    auto client = std::make_shared<MxReportingServerInstance>(1, host.root, host.root->serverQueue());
    Replies<bool> replies;
    client->createReportingSession(5, replies.callback());
    EXPECT_THAT(replies.values, IsEmpty()) << "nothing but logging happens on the caller's thread";
    EXPECT_FALSE(platform.log.contains("creating session for reporter 5")) << "verbose switch is off";
    EXPECT_TRUE(platform.trace.codes().empty());
    run();
    EXPECT_THAT(replies.values, ElementsAre(true));

    client->createReportingSession(6, replies.callback());
    client.reset();
    run();
    EXPECT_THAT(replies.values, ElementsAre(true)) << "no reply for a vanished endpoint";
    EXPECT_TRUE(platform.log.contains("dealloc 1 from the server client list"));
}

} // namespace
} // namespace mx::testing
