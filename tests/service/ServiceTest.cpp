// Per-client request handling (the eleven operations as one or more clients see them), the
// service delegate (connections, client removal) and the defaults with the reporting switch.
#include <memory>
#include <string>
#include <vector>

#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using testing::BoolReplies;
using testing::Client;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using testing::FakeIpcConnection;
using testing::FakePlatform;
using ::testing::HasSubstr;
using testing::Replies;
using testing::ServiceHarness;

constexpr const char* kUptimeEvent = "com.norvel.quenta.qnreportingclientuptime";
constexpr const char* kSuite = "com.norvel.quenta";

class ServiceTest : public ::testing::Test {
 protected:
  explicit ServiceTest(const std::function<void(FakePlatform&)>& setup = nullptr,
                       QNReportingServiceDelegate::Options options = {})
      : h_(setup, options) {}

  ServiceHarness h_;
  testing::LogCapture& log_ = *h_.env.log;
  testing::FakeLivoReporting& livo_ = *h_.env.livo;
};

TEST_F(ServiceTest, SetServiceTypeTouchesOnlyTheCallersOwnSessions) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  h_.Create(a, 42);
  BoolReplies r;
  b->setServiceType(2, 42, r.Callback());
  b->setServiceType(2, 0, r.Callback());
  h_.Run();
  EXPECT_EQ(a.Session(42)->serviceType(), 65535);
  EXPECT_EQ(log_.Count("set for reporter"), 0);

  a->setServiceType(7, 42, r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(true, true, true));
  EXPECT_EQ(a.Session(42)->serviceName(), "longformaudio");
  EXPECT_EQ(log_.Count(": service type 7 set for reporter  42"), 1);
}

TEST_F(ServiceTest, GetServiceNameSearchOrderAndZero) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  h_.Create(a, 42, 2);
  Replies<std::uint16_t> r;
  b->getServiceNameForReporterID(42, r.Callback());
  b->getServiceNameForReporterID(43, r.Callback());
  a->getServiceNameForReporterID(0, r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(2, 65535, 65535, 65535));
  EXPECT_EQ(log_.Count(": returnning service type 2 for reporter  42"), 1);

  h_.Create(a, 0);  // a session under ID 0 is allowed, and found by the second answer
  a.Session(0)->setServiceType(3);  // (the protocol cannot type it: ID 0 is refused there)
  Replies<std::uint16_t> own;
  a->getServiceNameForReporterID(0, own.Callback());
  h_.Run();
  EXPECT_THAT(own.all(), ElementsAre(65535, 3));
}

TEST_F(ServiceTest, StartHoldsItsReplyUntilStopAndANewStartDeliversTheOneItReplaces) {
  Client a = h_.Connect(100);
  h_.Create(a, 42, 2);
  std::vector<std::string> order;
  a->startReportingSessionForID(42,
                                [&](bool ok) { order.push_back(ok ? "start YES" : "start NO"); });
  h_.Run();
  auto session = a.Session(42);
  EXPECT_TRUE(order.empty());
  EXPECT_TRUE(session->started());
  ASSERT_TRUE(session->driverSnapShot());  // empty without drivers, but present
  EXPECT_EQ(livo_.Sessions().size(), 1u);

  a->stopReportingSessionForID(42, [&](bool ok) { order.push_back(ok ? "stop YES" : "stop NO"); });
  h_.Run();
  EXPECT_THAT(order, ElementsAre("start YES", "stop YES"));
  EXPECT_FALSE(session->started());
  EXPECT_FALSE(session->driverSnapShot());
  EXPECT_FALSE(session->transactionCompleteBlock());
  EXPECT_EQ(log_.Count(": nothing interesting to fetch from the drivers"), 1);
  EXPECT_EQ(log_.Count(": stopping 42"), 1);

  BoolReplies first = h_.Create(a, 7, std::nullopt, true);
  a.Session(7)->stop();  // stopped behind the handler's back: the reply stays pending
  EXPECT_TRUE(first.empty());
  BoolReplies second;
  a->startReportingSessionForID(7, second.Callback());
  h_.Run();
  EXPECT_THAT(first.all(), ElementsAre(true));
  EXPECT_TRUE(second.empty());
  EXPECT_TRUE(a.Session(7)->started());
}

TEST_F(ServiceTest, StartReachesAnotherClientsSessionButStopDoesNot) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  h_.Create(a, 42);
  BoolReplies startByB, stopByB, stopByA;
  b->startReportingSessionForID(42, startByB.Callback());
  h_.Run();
  auto session = a.Session(42);
  EXPECT_TRUE(session->started());
  b->stopReportingSessionForID(42, stopByB.Callback());
  h_.Run();
  EXPECT_THAT(stopByB.all(), ElementsAre(true));
  EXPECT_TRUE(session->started());
  EXPECT_TRUE(startByB.empty());
  EXPECT_EQ(log_.Count(": stopping 42"), 1);  // logged although nothing was stopped

  a->stopReportingSessionForID(42, stopByA.Callback());
  h_.Run();
  EXPECT_FALSE(session->started());
  EXPECT_THAT(startByB.all(), ElementsAre(true));  // B's reply travels with the session
}

TEST_F(ServiceTest, StartStopAndDestroyOfZeroOrUnknownIDsReplyAtOnce) {
  Client a = h_.Connect(100);
  BoolReplies r;
  for (std::int64_t id : {0, 99}) {
    a->startReportingSessionForID(id, r.Callback());
    a->stopReportingSessionForID(id, r.Callback());
    a->destroyReportingSession(id, r.Callback());
  }
  h_.Run();
  EXPECT_EQ(r.size(), 6u);
  EXPECT_EQ(log_.Count(": stopping 0") + log_.Count(": destroying 0"), 0);
  EXPECT_EQ(log_.Count(": stopping 99"), 1);
  EXPECT_EQ(log_.Count(": destroying 99"), 1);
  EXPECT_THAT(h_.env.trace->Codes(), ElementsAre(0x21042818u, 0x2104281Cu, 0x21042820u, 0x21042818u,
                                                 0x2104281Cu, 0x21042820u));
  EXPECT_TRUE(h_.env.trace->AllArgumentsZero());
}

TEST_F(ServiceTest, BroadcastReachesEveryStartedSessionOfEveryClient) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  h_.Create(a, 1, 2, true);
  h_.Create(a, 2, 2);
  h_.Create(b, 3, 7, true);
  EXPECT_FALSE(h_.Send(b, {{"k", "v"}}, 3, 1, std::nullopt));

  auto sessions = livo_.Sessions();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[0].messages.size(), 1u);
  EXPECT_EQ(sessions[1].messages.size(), 1u);
  EXPECT_TRUE(livo_.SingleMessages().empty());
  EXPECT_EQ(h_.env.analytics->EventsNamed("com.norvel.quenta.Playback.Start").size(), 2u);
  EXPECT_EQ(log_.Count(": sessions for client 100 : "), 1);
  EXPECT_EQ(log_.Count(": sessions for client 200 : "), 1);
  EXPECT_EQ(log_.Count(": active reporting sessions 2 : "), 1);
}

TEST_F(ServiceTest, GetAllReportersListsClientByClientInMapOrder) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  const std::pair<Client*, std::int64_t> creates[] = {{&a, 3}, {&a, 1}, {&a, 3}, {&b, 2}, {&b, 3}};
  for (auto [c, id] : creates) h_.Create(*c, id);
  Replies<std::vector<std::int64_t>> r;
  b->getAllReporters(r.Callback());  // replacing 3 kept its place
  a->destroyReportingSession(3, BoolReplies().Callback());
  a->getAllReporters(r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(ElementsAre(3, 1, 2, 3), ElementsAre(1, 2, 3)));
}

// With room for 8 sessions per client.
class SessionLimitTest : public ServiceTest {
 protected:
  SessionLimitTest() : ServiceTest(nullptr, {.maxSessionsPerClient = 8}) {}
};

TEST_F(SessionLimitTest, TooManySessionsForOneClientAreNotMade) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  BoolReplies r;
  for (std::int64_t id = 1; id <= 9; ++id) a->createReportingSession(id, r.Callback());
  a->createReportingSession(1, r.Callback());  // replacing an existing ID still works
  h_.Run();
  EXPECT_EQ(r.size(), 10u);
  EXPECT_EQ(a->clientReportingSessionMap().size(), 8u);
  EXPECT_FALSE(a.Session(9));
  EXPECT_EQ(log_.Count(": client 100 already holds 8 sessions, no session for reporter 9"), 1);
  h_.Create(b, 9);  // the limit is per client
  EXPECT_TRUE(b.Session(9));
}

// With the "Speaker" driver counter X at 5 before the service starts.
class DriverStatisticsTest : public ServiceTest {
 protected:
  DriverStatisticsTest()
      : ServiceTest([](FakePlatform& env) { env.ostrel->SetCounter("Speaker", "Main", "X", 5); }) {}
};

TEST_F(DriverStatisticsTest, StopSendsTheCountersThatGrew) {
  Client a = h_.Connect(100);
  h_.Create(a, 42, 2, true);
  h_.env.ostrel->SetCounter("Speaker", "Main", "X", 12);
  a->stopReportingSessionForID(42, BoolReplies().Callback());
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

// --- The delegate: connections ending ------------------------------------------------------

TEST_F(ServiceTest, EndBeforeListingLogsAMissingStartDate) {
  h_.env.process->SetName(100, "player");
  auto connection = std::make_shared<FakeIpcConnection>(100);
  h_.listener->Accept(connection);
  log_.Clear();
  connection->Invalidate();
  std::vector<std::string> texts;
  for (const auto& line : log_.Lines()) texts.push_back(line.text);
  EXPECT_THAT(texts, ElementsAre(EndsWith(": clientStartDate is nil. clientpid=100 "
                                          "clientprocessname=unknown"),
                                 EndsWith(": InvalidationHandler: connection exited process=(null) "
                                          "uptime_sec=-1"),
                                 EndsWith(": clientProcessName is nil. clientpid=100")));
  EXPECT_TRUE(h_.env.analytics->Events().empty());

  // The listing still runs first (the removal is queued behind it), then the removal.
  h_.Run();
  EXPECT_TRUE(h_.delegate->clients().empty());
  EXPECT_EQ(log_.Count(": removing 100 from the server client list"), 1);
  EXPECT_EQ(log_.Count(": dealloc 100 from the server client list"), 1);
}

TEST_F(ServiceTest, InterruptionRemovesTheClientInvalidationOnlyReports) {
  Client a = h_.Connect(100, "player");
  h_.Create(a, 42, std::nullopt, true);
  auto session = a.Session(42);
  a.instance.reset();

  a.connection->Interrupt();
  EXPECT_EQ(log_.Count(": InterruptionHandler: connection exited"), 1);
  h_.Run();
  EXPECT_TRUE(h_.delegate->clients().empty());
  EXPECT_FALSE(session->started());

  a.connection->Invalidate();
  h_.Run();
  EXPECT_EQ(log_.Count(": removing 100 from the server client list"), 1);
  EXPECT_EQ(h_.env.analytics->EventsNamed(kUptimeEvent).size(), 1u);
}

// --- Defaults and the reporting switch -----------------------------------------------------

TEST_F(ServiceTest, ANotificationReReadsTheSuiteAndPushesItToEverySession) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  h_.Create(a, 1);
  h_.Create(b, 2, std::nullopt, true);
  h_.env.defaults->Set(kSuite, "device_name", "kitchen");
  h_.PostDefaults();
  auto defaults = h_.delegate->getDefaults();
  ASSERT_TRUE(defaults);
  EXPECT_EQ(*defaults, (Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));
  EXPECT_TRUE(h_.delegate->isReportingEnabled());
  for (auto session : {a.Session(1), b.Session(2)}) {
    EXPECT_EQ(*session->userInfo()->Find("device_name"), Value("kitchen"));
  }
  EXPECT_EQ(log_.Count(": re-reading quenta defaults"), 1);
  EXPECT_THAT(log_.Matching(": defaults {"), ElementsAre(HasSubstr("kitchen")));

  // A suite without "device_name" gives defaults without it.
  h_.env.defaults->Remove(kSuite, "device_name");
  h_.PostDefaults();
  EXPECT_EQ(*h_.delegate->getDefaults(), (Dictionary{{"disable_reporting", 0}}));
  EXPECT_NE(h_.delegate->getDefaults(), defaults);  // a fresh dictionary each time
}

TEST_F(ServiceTest, DisabledReportingRefusesSendsHidesOthers) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  h_.Create(a, 42, std::nullopt, true);
  h_.env.defaults->Set(kSuite, "disable_reporting", "YES");
  h_.PostDefaults();
  EXPECT_FALSE(h_.delegate->isReportingEnabled());
  for (auto ids : {std::optional<std::vector<std::int64_t>>{{42}},
                   std::optional<std::vector<std::int64_t>>{}}) {
    auto error = h_.Send(a, {{"EngineOnTime", 1}}, 1, 6, ids);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, "com.norvel.audio.reporting");
    EXPECT_EQ(error->code, 1);
  }
  EXPECT_TRUE(h_.env.enerdex->Events().empty());
  EXPECT_TRUE(h_.env.analytics->Events().empty());
  EXPECT_TRUE(livo_.AllSessionMessages().empty());
  EXPECT_TRUE(livo_.SingleMessages().empty());

  // Cross-client lookups find nothing, even for the caller's own ID; own lookups still work.
  EXPECT_FALSE(h_.delegate->findReportingSessionForID(42));
  Replies<Dictionary> valid;
  b->reporterIDValid(42, valid.Callback());
  a->reporterIDValid(42, valid.Callback());
  h_.Run();
  EXPECT_THAT(valid.all(), ElementsAre(Dictionary{{"reporterID", 0}, {"serviceType", 65535}},
                                       Dictionary{{"reporterID", 42}, {"serviceType", 65535}}));

  // Removing the value enables reporting again.
  h_.env.defaults->Remove(kSuite, "disable_reporting");
  h_.PostDefaults();
  EXPECT_TRUE(h_.delegate->isReportingEnabled());
  EXPECT_FALSE(h_.Send(a, {{"EngineOnTime", 1}}, 1, 6, std::vector<std::int64_t>{42}));
  EXPECT_EQ(h_.env.enerdex->Events().size(), 1u);
}

TEST(DefaultsRegistrationTest, FailedRegistrationLeavesReportingOn) {
  ServiceHarness h([](FakePlatform& env) {
    env.notify->FailRegistrations(5);
    env.defaults->Set(kSuite, "disable_reporting", true);
  });
  EXPECT_EQ(h.env.log->Count(": notify setup result 5"), 1);
  h.PostDefaults();
  EXPECT_TRUE(h.delegate->isReportingEnabled());
  EXPECT_FALSE(h.delegate->getDefaults());
}

}  // namespace
}  // namespace qn
