// Per-client request handling: the eleven operations, as seen by one or more clients.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::HasSubstr;
using testing::ProcessExited;
using testing::service::BoolReplies;
using testing::service::Client;
using testing::service::ErrorReplies;
using testing::service::Replies;
using testing::service::ServiceHarness;

MessagePayload Payload(Dictionary d) { return std::make_shared<const Dictionary>(std::move(d)); }

class ServerInstanceTest : public ::testing::Test {
 protected:
  explicit ServerInstanceTest(const std::function<void(FakePlatform&)>& setup = nullptr,
                              QNReportingServiceDelegate::Options options = {})
      : h_(setup, options) {}

  void Create(const Client& c, std::int64_t id, std::uint16_t serviceType = 65535) {
    BoolReplies r;
    c->createReportingSession(id, r.Callback());
    if (serviceType != 65535) c->setServiceType(serviceType, id, r.Callback());
    h_.Run();
  }
  // Starts `id` and returns the (deferred) start reply's record.
  BoolReplies Start(const Client& c, std::int64_t id) {
    BoolReplies r;
    c->startReportingSessionForID(id, r.Callback());
    h_.Run();
    return r;
  }
  std::optional<Error> Send(const Client& c, Dictionary message, std::uint32_t category,
                            std::uint16_t type, std::optional<std::vector<std::int64_t>> ids) {
    ErrorReplies r;
    c->sendMessage(Payload(std::move(message)), category, type, std::move(ids), r.Callback());
    h_.Run();
    EXPECT_EQ(r.size(), 1u);
    return r.empty() ? std::nullopt : r[0];
  }
  Dictionary Valid(const Client& c, std::int64_t id) {
    Replies<Dictionary> r;
    c->reporterIDValid(id, r.Callback());
    h_.Run();
    EXPECT_EQ(r.size(), 1u);
    return r.empty() ? Dictionary{} : r[0];
  }
  std::vector<std::int64_t> AllReporters(const Client& c) {
    Replies<std::vector<std::int64_t>> r;
    c->getAllReporters(r.Callback());
    h_.Run();
    EXPECT_EQ(r.size(), 1u);
    return r.empty() ? std::vector<std::int64_t>{} : r[0];
  }

  ServiceHarness h_;
  testing::LogCapture& log_ = *h_.env.log;
  testing::FakeLivoReporting& livo_ = *h_.env.livo;
};

// With the "Speaker" driver counter X at 5 before the service starts.
class DriverStatisticsTest : public ServerInstanceTest {
 protected:
  DriverStatisticsTest()
      : ServerInstanceTest(
            [](FakePlatform& env) { env.ostrel->SetCounter("Speaker", "Main", "X", 5); }) {}
};

TEST_F(ServerInstanceTest, RequestsRunOnTheServerQueueInArrivalOrder) {
  Client a = h_.Connect(100, "player");
  std::vector<std::string> order;
  a->createReportingSession(42, [&](bool) { order.push_back("create"); });
  a->reporterIDValid(
      42, [&](Dictionary d) { order.push_back("valid " + d.Find("reporterID")->Description()); });
  a->destroyReportingSession(42, [&](bool) { order.push_back("destroy"); });
  a->reporterIDValid(
      42, [&](Dictionary d) { order.push_back("valid " + d.Find("reporterID")->Description()); });
  EXPECT_TRUE(order.empty());  // nothing happens on the caller's thread
  h_.Run();
  EXPECT_THAT(order, ElementsAre("create", "valid 42", "destroy", "valid 0"));
}

TEST_F(ServerInstanceTest, EntryLinesAreDebugLinesOfTheServerScopeOnlyWhenVerbose) {
  Client a = h_.Connect(100);
  BoolReplies b;
  a->getServiceNameForReporterID(5, Replies<std::uint16_t>().Callback());
  a->createReportingSession(5, b.Callback());
  EXPECT_EQ(log_.Count("fetching seviceType"), 0);
  EXPECT_EQ(log_.Count("creating session for reporter"), 0);
  h_.Run();

  log_.EnableDebug("qnrs");
  log_.Clear();
  a->createReportingSession(5, b.Callback());
  a->setServiceType(2, 5, b.Callback());
  a->getServiceNameForReporterID(5, Replies<std::uint16_t>().Callback());
  a->setConfiguration(Payload({}), 5, b.Callback());
  a->startReportingSessionForID(5, b.Callback());
  a->sendMessage(Payload({}), 1, 1, std::vector<std::int64_t>{5, 6}, ErrorReplies().Callback());
  a->sendMessage(Payload({}), 1, 1, std::nullopt, ErrorReplies().Callback());
  a->stopReportingSessionForID(5, b.Callback());
  a->destroyReportingSession(5, b.Callback());
  a->reporterIDValid(5, Replies<Dictionary>().Callback());
  a->getAllReporters(Replies<std::vector<std::int64_t>>().Callback());
  // Written at once, on the caller's thread, before any request ran.
  std::vector<std::string> texts;
  for (const auto& line : log_.Lines()) {
    EXPECT_EQ(line.level, LogLevel::kDebug);
    EXPECT_EQ(line.scope, "qnrs");
    EXPECT_THAT(line.text, HasSubstr("QNReportingServerInstance.cpp:"));
    texts.push_back(line.text.substr(line.text.rfind(": ") + 2));
  }
  EXPECT_THAT(
      texts,
      ElementsAre("creating session for reporter 5", "setting service type 2 for reporter 5",
                  "fetching seviceType", "setting configuration", "starting session for reporter 5",
                  "sending message for reporter (\n    5,\n    6\n)",
                  "sending message for reporter (null)", "stopping session for reporter 5",
                  "destroying session for reporter 5", "validating reporter 5"));
  h_.Run();
}

TEST_F(ServerInstanceTest, CreateTwiceReplacesTheSessionAndRepliesYesBothTimes) {
  Client a = h_.Connect(100);
  BoolReplies r;
  a->createReportingSession(42, r.Callback());
  h_.Run();
  auto first = a.Session(42);
  ASSERT_TRUE(first);
  EXPECT_THAT(first->processIdentifiers(), ElementsAre(Value(100)));
  Start(a, 42);
  a->createReportingSession(42, r.Callback());
  h_.Run();

  EXPECT_THAT(r.all(), ElementsAre(true, true));
  EXPECT_EQ(a->clientReportingSessionMap().size(), 1u);
  EXPECT_NE(a.Session(42), first);
  EXPECT_TRUE(first->started());  // the replaced session is neither stopped nor destroyed
  EXPECT_EQ(log_.Count(": session created for reporter 42"), 2);
  EXPECT_EQ(h_.env.trace->Count(0x21042814), 2);
}

TEST_F(ServerInstanceTest, SetServiceTypeTouchesOnlyTheCallersOwnSessions) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 42);
  BoolReplies r;
  b->setServiceType(2, 42, r.Callback());
  b->setServiceType(2, 0, r.Callback());
  h_.Run();
  EXPECT_EQ(a.Session(42)->serviceType(), 65535);
  EXPECT_EQ(log_.Count("set for reporter"), 0);

  a->setServiceType(7, 42, r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(true, true, true));
  EXPECT_EQ(a.Session(42)->serviceType(), 7);
  EXPECT_EQ(a.Session(42)->serviceName(), "longformaudio");
  EXPECT_EQ(log_.Count(": service type 7 set for reporter  42"), 1);
}

TEST_F(ServerInstanceTest, GetServiceNameSearchesOwnThenAllClientsAndRepliesTwiceForZero) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 42, 2);
  Replies<std::uint16_t> r;
  b->getServiceNameForReporterID(42, r.Callback());
  b->getServiceNameForReporterID(43, r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(2, 65535));
  EXPECT_EQ(log_.Count(": returnning service type 2 for reporter  42"), 1);

  Replies<std::uint16_t> zero;
  a->getServiceNameForReporterID(0, zero.Callback());
  h_.Run();
  EXPECT_THAT(zero.all(), ElementsAre(65535, 65535));

  Create(a, 0);  // a session under ID 0 is allowed, and found by the second answer
  a.Session(0)->setServiceType(3);  // (the protocol cannot type it: ID 0 is refused there)
  Replies<std::uint16_t> own;
  a->getServiceNameForReporterID(0, own.Callback());
  h_.Run();
  EXPECT_THAT(own.all(), ElementsAre(65535, 3));
}

TEST_F(ServerInstanceTest, SetConfigurationReachesOnlyOwnSessions) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 42);
  BoolReplies r;
  b->setConfiguration(Payload({{"HostApplicationDisplayID", "b"}}), 42, r.Callback());
  a->setConfiguration(Payload({{"HostApplicationDisplayID", "a"}}), 42, r.Callback());
  a->setConfiguration(Payload({{"x", 1}}), 99, r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(true, true, true));
  EXPECT_EQ(*a.Session(42)->userInfo(), (Dictionary{{"HostApplicationDisplayID", "a"}}));
}

TEST_F(ServerInstanceTest, StartHoldsItsReplyUntilStop) {
  Client a = h_.Connect(100);
  Create(a, 42, 2);
  std::vector<std::string> order;
  a->startReportingSessionForID(42,
                                [&](bool ok) { order.push_back(ok ? "start YES" : "start NO"); });
  h_.Run();
  auto session = a.Session(42);
  EXPECT_TRUE(order.empty());
  EXPECT_TRUE(session->started());
  ASSERT_TRUE(session->driverSnapShot());  // empty without drivers, but present
  EXPECT_TRUE(session->transactionCompleteBlock());
  EXPECT_EQ(livo_.Sessions().size(), 1u);

  a->stopReportingSessionForID(42, [&](bool ok) { order.push_back(ok ? "stop YES" : "stop NO"); });
  h_.Run();
  EXPECT_THAT(order, ElementsAre("start YES", "stop YES"));
  EXPECT_FALSE(session->started());
  EXPECT_FALSE(session->driverSnapShot());
  EXPECT_FALSE(session->transactionCompleteBlock());
  EXPECT_EQ(log_.Count(": nothing interesting to fetch from the drivers"), 1);
  EXPECT_EQ(log_.Count(": stopping 42"), 1);
}

TEST_F(ServerInstanceTest, StartOfAStartedSessionRepliesAtOnceAndKeepsThePendingReply) {
  Client a = h_.Connect(100);
  Create(a, 42);
  BoolReplies first = Start(a, 42);
  BoolReplies second = Start(a, 42);
  EXPECT_TRUE(first.empty());
  EXPECT_THAT(second.all(), ElementsAre(true));
  EXPECT_EQ(livo_.Sessions().size(), 1u);

  BoolReplies stop;
  a->stopReportingSessionForID(42, stop.Callback());
  h_.Run();
  EXPECT_THAT(first.all(), ElementsAre(true));
}

TEST_F(ServerInstanceTest, ANewStartDeliversThePendingReplyItReplaces) {
  Client a = h_.Connect(100);
  Create(a, 42);
  BoolReplies first = Start(a, 42);
  a.Session(42)->stop();  // stopped behind the handler's back: the reply stays pending
  EXPECT_TRUE(first.empty());

  BoolReplies second = Start(a, 42);
  EXPECT_THAT(first.all(), ElementsAre(true));
  EXPECT_TRUE(second.empty());
  EXPECT_TRUE(a.Session(42)->started());
}

TEST_F(ServerInstanceTest, StartReachesAnotherClientsSessionButStopDoesNot) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 42);
  BoolReplies startByB = Start(b, 42);
  auto session = a.Session(42);
  EXPECT_TRUE(session->started());
  EXPECT_TRUE(startByB.empty());

  BoolReplies stopByB;
  b->stopReportingSessionForID(42, stopByB.Callback());
  h_.Run();
  EXPECT_THAT(stopByB.all(), ElementsAre(true));
  EXPECT_TRUE(session->started());
  EXPECT_TRUE(startByB.empty());
  EXPECT_EQ(log_.Count(": stopping 42"), 1);  // logged although nothing was stopped

  BoolReplies stopByA;
  a->stopReportingSessionForID(42, stopByA.Callback());
  h_.Run();
  EXPECT_FALSE(session->started());
  EXPECT_THAT(startByB.all(), ElementsAre(true));  // B's reply travels with the session
}

TEST_F(ServerInstanceTest, StartStopAndDestroyOfZeroOrUnknownIDsReplyAtOnce) {
  Client a = h_.Connect(100);
  BoolReplies r;
  for (std::int64_t id : {0, 99}) {
    a->startReportingSessionForID(id, r.Callback());
    a->stopReportingSessionForID(id, r.Callback());
    a->destroyReportingSession(id, r.Callback());
  }
  h_.Run();
  EXPECT_EQ(r.size(), 6u);
  EXPECT_EQ(log_.Count(": stopping 0"), 0);
  EXPECT_EQ(log_.Count(": destroying 0"), 0);
  EXPECT_EQ(log_.Count(": stopping 99"), 1);
  EXPECT_EQ(log_.Count(": destroying 99"), 1);
  EXPECT_THAT(h_.env.trace->Codes(), ElementsAre(0x21042818u, 0x2104281Cu, 0x21042820u, 0x21042818u,
                                                 0x2104281Cu, 0x21042820u));
  EXPECT_TRUE(h_.env.trace->AllArgumentsZero());
}

TEST_F(DriverStatisticsTest, StopSendsTheCountersThatGrewThroughTheSessionAndAnalytics) {
  Client a = h_.Connect(100);
  Create(a, 42, 2);
  Start(a, 42);
  h_.env.ostrel->SetCounter("Speaker", "Main", "X", 12);
  BoolReplies stop;
  a->stopReportingSessionForID(42, stop.Callback());
  h_.Run();

  auto messages = livo_.AllSessionMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[0].category, 9);
  EXPECT_EQ(messages[0].type, 0);
  EXPECT_EQ(messages[0].payload, Value(Dictionary{{"Speaker_X", 7}}));
  EXPECT_EQ(messages[1].category, 0xFFFF);  // the summary event follows
  auto events = h_.env.analytics->EventsNamed("com.norvel.quenta.Ostreling.Generic");
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].payload,
            Value(Dictionary{{"Speaker_X", 7}, {"HostApplicationDisplayID", "Unknown"}}));
  EXPECT_EQ(log_.Count(": fetching driver logs {"), 1);
  EXPECT_EQ(log_.Count("nothing interesting"), 0);
}

TEST_F(DriverStatisticsTest, DestroyStopsAStartedSessionWithoutStatisticsOrItsStartReply) {
  Client a = h_.Connect(100);
  Create(a, 42, 2);
  BoolReplies start = Start(a, 42);
  auto session = a.Session(42);
  h_.env.ostrel->SetCounter("Speaker", "Main", "X", 50);
  BoolReplies destroy;
  a->destroyReportingSession(42, destroy.Callback());
  h_.Run();

  EXPECT_THAT(destroy.all(), ElementsAre(true));
  EXPECT_FALSE(session->started());
  EXPECT_FALSE(a.Session(42));
  EXPECT_TRUE(start.empty());
  EXPECT_TRUE(session->transactionCompleteBlock());  // left in the session, never called
  for (const auto& m : livo_.AllSessionMessages()) EXPECT_NE(m.category, 9);
  EXPECT_TRUE(h_.env.analytics->EventsNamed("com.norvel.quenta.Ostreling.Generic").empty());
  EXPECT_EQ(log_.Count(": destroying 42"), 1);
}

TEST_F(ServerInstanceTest, ReporterIDValidAnswersExactlyTwoEntries) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 42, 2);
  const Dictionary unknown = Valid(a, 77);
  EXPECT_EQ(unknown, (Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
  EXPECT_EQ(unknown.begin()->first, Value("reporterID"));
  EXPECT_EQ(Valid(a, 42), (Dictionary{{"reporterID", 42}, {"serviceType", 2}}));
  EXPECT_EQ(Valid(b, 42), (Dictionary{{"reporterID", 42}, {"serviceType", 2}}));
  EXPECT_EQ(Valid(b, 0), (Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
  EXPECT_EQ(log_.Count(": validating reporter 77"), 1);
}

TEST_F(ServerInstanceTest, SendToListedIDsReachesEachFoundSessionAndItsBridges) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 42, 2);
  BoolReplies r;
  a->setConfiguration(Payload({{"HostApplicationDisplayID", "com.example.a"}}), 42, r.Callback());
  Start(a, 42);
  Create(b, 43, 4);  // not started

  auto error = Send(b, {{"EngineOnTime", 2}, {"qnreporting_timestamp", 9}}, 5, 6,
                    std::vector<std::int64_t>{42, 0, 999, 43});
  EXPECT_FALSE(error);
  h_.env.dispatcher->AdvanceBy(std::chrono::seconds(60));  // alarms go out after a delay

  auto framework = livo_.AllSessionMessages();
  ASSERT_EQ(framework.size(), 1u);
  EXPECT_EQ(framework[0].category, 5);
  auto singles = livo_.SingleMessages();
  ASSERT_EQ(singles.size(), 1u);  // 43 is not started: its session sends a single message
  EXPECT_EQ(*singles[0].user_info.Find(kLivoReportingUserInfoServiceName), Value("alarms"));
  auto events = h_.env.analytics->EventsNamed("com.norvel.quenta.Setup.Undefined");
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(*events[0].payload.as_dictionary()->Find("HostApplicationDisplayID"),
            Value("com.example.a"));
  auto power = h_.env.enerdex->Events();
  ASSERT_EQ(power.size(), 2u);
  EXPECT_EQ(*power[0].payload.as_dictionary()->Find("ApplicationName"), Value("com.example.a"));
  EXPECT_EQ(*power[1].payload.as_dictionary()->Find("ApplicationName"), Value("Unknown"));
  EXPECT_EQ(log_.Count("standalone"), 0);
  EXPECT_EQ(log_.Count("failed to find reporting session 999"), 1);
}

TEST_F(ServerInstanceTest, SendToOnlyZeroAndUnknownIDsDeliversNothing) {
  Client a = h_.Connect(100);
  Create(a, 42);
  Start(a, 42);
  EXPECT_FALSE(Send(a, {{"EngineOnTime", 1}}, 1, 6, std::vector<std::int64_t>{0, 999, -5}));
  EXPECT_FALSE(Send(a, {{"EngineOnTime", 1}}, 1, 6, std::vector<std::int64_t>{}));
  h_.env.dispatcher->AdvanceBy(std::chrono::seconds(60));
  EXPECT_TRUE(livo_.AllSessionMessages().empty());
  EXPECT_TRUE(livo_.SingleMessages().empty());
  EXPECT_TRUE(h_.env.analytics->Events().empty());
  EXPECT_TRUE(h_.env.enerdex->Events().empty());
  EXPECT_EQ(h_.env.trace->Count(0x21042824), 2);
}

TEST_F(ServerInstanceTest, BroadcastWithoutStartedSessionsGoesOutOnceAsStandalone) {
  Client a = h_.Connect(100);
  Create(a, 42);  // created, never started
  EXPECT_FALSE(Send(a, {{"EngineOnTime", 4}}, 0x00010005, 6, std::nullopt));

  auto singles = livo_.SingleMessages();
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0].category, 5);
  EXPECT_EQ(singles[0].type, 6);
  EXPECT_EQ(*singles[0].user_info.Find(kLivoReportingUserInfoServiceName), Value("standalone"));
  EXPECT_EQ(singles[0].payload, Value(Dictionary{{"EngineOnTime", 4}}));
  EXPECT_TRUE(livo_.AllSessionMessages().empty());
  EXPECT_TRUE(h_.env.analytics->Events().empty());  // the analytics bridge is not called
  auto power = h_.env.enerdex->Events();
  ASSERT_EQ(power.size(), 1u);
  EXPECT_EQ(*power[0].payload.as_dictionary()->Find("ApplicationName"), Value("Unknown"));
  EXPECT_EQ(log_.Count(": sessions for client 100 : ("), 1);
  EXPECT_EQ(log_.Count(": active reporting sessions 0 : ("), 1);
  EXPECT_EQ(log_.Count(": no active reporting sessions found, sending as standalone"), 1);
}

TEST_F(ServerInstanceTest, BroadcastReachesEveryStartedSessionOfEveryClient) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 1, 2);
  Create(a, 2, 2);
  Create(b, 3, 7);
  Start(a, 1);
  Start(b, 3);
  EXPECT_FALSE(Send(b, {{"k", "v"}}, 3, 1, std::nullopt));

  auto sessions = livo_.Sessions();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[0].messages.size(), 1u);
  EXPECT_EQ(sessions[1].messages.size(), 1u);
  EXPECT_TRUE(livo_.SingleMessages().empty());
  EXPECT_EQ(h_.env.analytics->EventsNamed("com.norvel.quenta.Playback.Start").size(), 2u);
  EXPECT_EQ(log_.Count(": sessions for client 100 : "), 1);
  EXPECT_EQ(log_.Count(": sessions for client 200 : "), 1);
  EXPECT_EQ(log_.Count(": active reporting sessions 2 : "), 1);
  EXPECT_EQ(log_.Count("standalone"), 0);
}

TEST_F(ServerInstanceTest, GetAllReportersListsClientByClientInMapOrder) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  Create(a, 3);
  Create(a, 1);
  Create(a, 3);  // replacing keeps the ID's place
  Create(b, 2);
  Create(b, 3);
  EXPECT_THAT(AllReporters(b), ElementsAre(3, 1, 2, 3));
  BoolReplies r;
  a->destroyReportingSession(3, r.Callback());
  h_.Run();
  EXPECT_THAT(AllReporters(a), ElementsAre(1, 2, 3));
}

TEST_F(ServerInstanceTest, KillServiceLogsAndExitsWithStatusTwoWithoutReplying) {
  Client a = h_.Connect(100);
  BoolReplies r;
  try {
    a->killService(r.Callback());
    FAIL() << "killService returned";
  } catch (const ProcessExited& exit) {
    EXPECT_EQ(exit.status, 2);
  }
  EXPECT_EQ(log_.Count("QNReportingServerInstance.cpp:"), 1 + log_.Count("new client"));
  EXPECT_EQ(log_.Count(": DESTROYING SERVICE"), 1);
  h_.Run();
  EXPECT_TRUE(r.empty());
}

// With room for 8 sessions per client.
class SessionLimitTest : public ServerInstanceTest {
 protected:
  SessionLimitTest() : ServerInstanceTest(nullptr, {.maxSessionsPerClient = 8}) {}
};

TEST_F(SessionLimitTest, TooManySessionsForOneClientAreNotMade) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  const std::size_t limit = 8;
  BoolReplies r;
  for (std::size_t id = 1; id <= limit + 1; ++id) {
    a->createReportingSession(static_cast<std::int64_t>(id), r.Callback());
  }
  a->createReportingSession(1, r.Callback());  // replacing an existing ID still works
  h_.Run();
  EXPECT_EQ(r.size(), limit + 2);
  EXPECT_EQ(a->clientReportingSessionMap().size(), limit);
  EXPECT_FALSE(a.Session(static_cast<std::int64_t>(limit + 1)));
  EXPECT_EQ(log_.Count(": client 100 already holds 8 sessions, no session for reporter 9"), 1);
  Create(b, 9);  // the limit is per client
  EXPECT_TRUE(b.Session(9));
}

TEST_F(ServerInstanceTest, TheSessionRegistryListsTheSessionsStillAlive) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  for (std::int64_t id : {1, 2, 3}) Create(a, id);
  Create(b, 4);
  BoolReplies r;
  a->destroyReportingSession(2, r.Callback());
  a->createReportingSession(3, r.Callback());  // the replaced session goes too
  h_.Run();
  std::vector<std::int64_t> ids;
  for (const auto& session : h_.delegate->context().sessions->Alive()) {
    ids.push_back(session->reporterID());
  }
  EXPECT_THAT(ids, ElementsAre(1, 4, 3));
}

}  // namespace
}  // namespace qn
