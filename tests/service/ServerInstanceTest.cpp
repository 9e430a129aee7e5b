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

TEST_F(ServerInstanceTest, GetServiceNameSearchOrderAndZero) {
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

TEST_F(DriverStatisticsTest, StopSendsTheCountersThatGrew) {
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

}  // namespace
}  // namespace qn
