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

TEST_F(ServiceDelegateTest, EndBeforeListingLogsAMissingStartDate) {
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

TEST_F(ServiceDelegateTest, InterruptionRemovesTheClientInvalidationOnlyReports) {
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

}  // namespace
}  // namespace qn
