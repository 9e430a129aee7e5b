// Service delegate: start-up, connection acceptance and listing, the connection-end step,
// client removal and the cross-client session search.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <string>

#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using ::testing::ElementsAre;
using testing::FakeIpcConnection;
using ::testing::HasSubstr;
using ::testing::Pair;
using testing::service::BoolReplies;
using testing::service::Client;
using testing::service::ServiceHarness;
using namespace std::chrono_literals;

constexpr const char* kUptimeEvent = "com.norvel.quenta.qnreportingclientuptime";

class ServiceDelegateTest : public ::testing::Test {
 protected:
  void CreateAndStart(const Client& c, std::int64_t id) {
    BoolReplies r;
    c->createReportingSession(id, r.Callback());
    c->startReportingSessionForID(id, r.Callback());
    h_.Run();
  }
  // Every line's whole text.
  std::vector<std::string> Texts() const {
    std::vector<std::string> out;
    for (const auto& line : h_.env.log->Lines()) out.push_back(line.text);
    return out;
  }
  // Matches a line whose text after its "file:line:function: " prefix is `text`.
  static auto Line(const std::string& text) { return ::testing::EndsWith(": " + text); }

  ServiceHarness h_;
  testing::LogCapture& log_ = *h_.env.log;
};

TEST_F(ServiceDelegateTest, CreationRegistersScopeQueueAndNotificationThenMakesTheDriverUtility) {
  EXPECT_EQ(log_.Registrations("qnrs"), 1);
  EXPECT_THAT(
      h_.env.dispatcher->CreatedQueues(),
      ElementsAre(Pair("com.norvel.quenta.reporting.server", QualityOfService::kUserInteractive)));
  EXPECT_EQ(h_.delegate->context().serverQueue->label(), "com.norvel.quenta.reporting.server");
  EXPECT_EQ(h_.env.notify->Registrations(kQNReportingDefaultsNotification), 1);
  EXPECT_TRUE(h_.delegate->reportingEnabled());
  EXPECT_FALSE(h_.delegate->getDefaults());
  EXPECT_EQ(h_.env.defaults->Opens(kQNReportingDefaultsSuite),
            0);  // not read until the first notification
  EXPECT_TRUE(h_.delegate->clients().empty());
  ASSERT_TRUE(h_.delegate->driverUtility());

  auto lines = log_.Lines();
  ASSERT_GE(lines.size(), 2u);
  EXPECT_THAT(lines[0].text, HasSubstr("QNReportingServiceDelegate.cpp:"));
  EXPECT_THAT(lines[0].text, HasSubstr(": notify setup result 0"));
  EXPECT_EQ(lines[0].scope, "qnrs");
  EXPECT_EQ(lines[1].scope, "qnrd");  // the driver utility comes last
}

TEST_F(ServiceDelegateTest, AcceptedConnectionIsExportedAtOnceAndListedOnTheServerQueue) {
  h_.env.process->SetName(100, "player");
  auto connection = std::make_shared<FakeIpcConnection>(100);
  EXPECT_TRUE(h_.listener->Accept(connection));
  EXPECT_TRUE(connection->resumed());
  EXPECT_TRUE(connection->exportedObject());
  EXPECT_TRUE(h_.delegate->clients().empty());  // listing is queued
  EXPECT_THAT(Texts(), ::testing::Contains(Line("newConnection: <FakeIpcConnection pid=100>")));
  EXPECT_THAT(Texts(), ::testing::Contains(Line("new client with pid 100")));

  h_.env.dispatcher->AdvanceBy(3s);
  ASSERT_EQ(h_.delegate->clients().size(), 1u);
  auto instance = h_.delegate->clients()[0];
  EXPECT_EQ(instance->processIdentifier(), 100);
  EXPECT_EQ(instance->clientProcessName(), "player");
  ASSERT_TRUE(instance->clientStartDate());
  // The listing ran before the clock moved.
  const double now =
      std::chrono::duration<double>(h_.env.dispatcher->WallNow().time_since_epoch()).count();
  EXPECT_DOUBLE_EQ(instance->clientStartDate()->seconds_since_1970, now - 3.0);
}

TEST_F(ServiceDelegateTest, ProcessNamesComeFromTheOwnNameOrTheProcessTable) {
  h_.env.process->SetPid(300);
  Client own = h_.Connect(300);
  Client unnamed = h_.Connect(301);
  Client zero = h_.Connect(0);
  Client negative = h_.Connect(-4);
  EXPECT_EQ(own->clientProcessName(), "qnreportingd");
  EXPECT_FALSE(unnamed->clientProcessName());
  EXPECT_FALSE(zero->clientProcessName());
  EXPECT_FALSE(negative->clientProcessName());
}

TEST_F(ServiceDelegateTest, ConnectionEndStopsSessionsRemovesTheClientAndSendsItsUptime) {
  Client a = h_.Connect(100, "player");
  Client b = h_.Connect(200, "recorder");
  CreateAndStart(a, 42);
  BoolReplies r;
  a->createReportingSession(43, r.Callback());
  h_.Run();
  auto started = a.Session(42);
  auto idle = a.Session(43);
  std::weak_ptr<QNReportingServerInstance> weak = a.instance;
  a.instance.reset();
  h_.env.dispatcher->AdvanceBy(5s);

  log_.Clear();
  a.connection->Invalidate();
  // On the IPC thread: the log lines and the event; the removal waits for the server queue.
  EXPECT_THAT(Texts(), ElementsAre(Line("InvalidationHandler: connection exited process=player "
                                        "uptime_sec=5")));
  auto events = h_.env.analytics->EventsNamed(kUptimeEvent);
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].payload, Value(Dictionary{{"processName", "player"}, {"seconds", 5.0}}));
  EXPECT_EQ(h_.delegate->clients().size(), 2u);

  h_.Run();
  ASSERT_EQ(h_.delegate->clients().size(), 1u);
  EXPECT_EQ(h_.delegate->clients()[0], b.instance);
  EXPECT_FALSE(started->started());
  EXPECT_FALSE(idle->started());
  EXPECT_TRUE(started->transactionCompleteBlock());  // the start reply is never delivered
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(log_.Count(": removing 100 from the server client list"), 1);
  EXPECT_EQ(log_.Count(": dealloc 100 from the server client list"), 1);
  // Stopped without driver statistics.
  EXPECT_EQ(log_.Count("nothing interesting"), 0);
}

TEST_F(ServiceDelegateTest, ConnectionEndingBeforeItsListingLogsAMissingStartDate) {
  h_.env.process->SetName(100, "player");
  auto connection = std::make_shared<FakeIpcConnection>(100);
  h_.listener->Accept(connection);
  log_.Clear();
  connection->Invalidate();
  EXPECT_THAT(Texts(),
              ElementsAre(Line("clientStartDate is nil. clientpid=100 clientprocessname=unknown"),
                          Line("InvalidationHandler: connection exited process=(null) "
                               "uptime_sec=-1"),
                          Line("clientProcessName is nil. clientpid=100")));
  EXPECT_TRUE(h_.env.analytics->Events().empty());

  // The listing still runs first (the removal is queued behind it), then the removal.
  h_.Run();
  EXPECT_TRUE(h_.delegate->clients().empty());
  EXPECT_EQ(log_.Count(": removing 100 from the server client list"), 1);
  EXPECT_EQ(log_.Count(": dealloc 100 from the server client list"), 1);
}

TEST_F(ServiceDelegateTest, APeerWithoutANameSendsNoUptimeEvent) {
  Client zero = h_.Connect(0);
  zero.instance.reset();
  zero.connection->Invalidate();
  h_.Run();
  EXPECT_EQ(log_.Count(": InvalidationHandler: connection exited process=(null) uptime_sec=0"), 1);
  EXPECT_EQ(log_.Count(": clientProcessName is nil. clientpid=0"), 1);
  EXPECT_TRUE(h_.env.analytics->Events().empty());
  EXPECT_TRUE(h_.delegate->clients().empty());
}

TEST_F(ServiceDelegateTest, InterruptionRemovesTheClientAndTheLaterInvalidationOnlyReports) {
  Client a = h_.Connect(100, "player");
  CreateAndStart(a, 42);
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

TEST_F(ServiceDelegateTest, FindReportingSessionForIDTakesTheFirstAcceptedClient) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  BoolReplies r;
  b->createReportingSession(7, r.Callback());
  a->createReportingSession(7, r.Callback());
  h_.Run();

  log_.Clear();
  EXPECT_EQ(h_.delegate->findReportingSessionForID(7), a.Session(7));
  EXPECT_THAT(log_.Matching("found"), ElementsAre(HasSubstr(": found reporting session 7 for "
                                                            "client 100")));
  EXPECT_EQ(log_.Lines()[0].level, LogLevel::kInfo);

  EXPECT_FALSE(h_.delegate->findReportingSessionForID(8));
  EXPECT_THAT(log_.Matching("failed"), ElementsAre(HasSubstr(": failed to find reporting "
                                                             "session 8")));
  EXPECT_EQ(log_.Lines()[1].level, LogLevel::kError);

  log_.Clear();
  EXPECT_FALSE(h_.delegate->findReportingSessionForID(0));
  EXPECT_TRUE(log_.Lines().empty());

  // Once the first client is gone, the second one's session is found.
  a.instance.reset();
  a.connection->Invalidate();
  h_.Run();
  EXPECT_EQ(h_.delegate->findReportingSessionForID(7), b.Session(7));
}

}  // namespace
}  // namespace qn
