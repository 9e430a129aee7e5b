// Sessions end to end: the real daemon, the real client library, the rows in the store.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <string>
#include <vector>

#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using ::testing::ElementsAre;
using Table = ReportingStoreRow::Table;

void WriteCounter(const std::string& path, std::int64_t value) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path) << value << "\n";
}

std::string OwnCommandName() {
  std::ifstream in("/proc/self/comm");
  std::string name;
  std::getline(in, name);
  return name;
}

const Value* Field(const Value& dictionary, const char* key) {
  const Dictionary* d = dictionary.as_dictionary();
  return d ? d->Find(key) : nullptr;
}

TEST(SessionFlowTest, WholeSessionLandsInTheStore) {
  testing::TempDir stats;
  const std::string counter = stats.path() + "/Speaker/Main/frames";
  WriteCounter(counter, 10);  // the daemon subscribes to its drivers at start-up
  Daemon daemon({"--driver-stats", stats.path()});
  ASSERT_TRUE(daemon.started());
  auto client = daemon.Connect();
  ASSERT_TRUE(client);

  EXPECT_EQ(client->createReportingSessionSync(42), true);
  EXPECT_EQ(client->setServiceTypeSync(2, 42), true);
  EXPECT_EQ(client->setConfigurationSync(
                Value(Dictionary{{"HostApplicationDisplayID", "com.example.app"}}), 42),
            true);
  std::mutex mu;
  std::vector<std::string> order;
  client->startReportingSessionForID(42, [&](bool ok) {
    std::lock_guard lock(mu);
    order.push_back(ok ? "start YES" : "start NO");
  });
  EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"route", "speaker"}}),
                                                          5, 1, std::vector<std::int64_t>{42})));
  EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"two words", 1}}), 11,
                                                          2, std::vector<std::int64_t>{42})));
  {
    std::lock_guard lock(mu);
    EXPECT_TRUE(order.empty()) << "the start reply waits for the stop";
  }
  WriteCounter(counter, 25);
  client->stopReportingSessionForID(42, [&](bool ok) {
    std::lock_guard lock(mu);
    order.push_back(ok ? "stop YES" : "stop NO");
  });
  ASSERT_TRUE(client->WaitForReplies());
  {
    std::lock_guard lock(mu);
    EXPECT_THAT(order, ElementsAre("start YES", "stop YES"));
  }
  EXPECT_EQ(client->destroyReportingSessionSync(42), true);
  EXPECT_EQ(client->reporterIDValidSync(42),
            (Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
  client.reset();
  EXPECT_EQ(daemon.Stop(), Exited(0));

  const auto rows = daemon.Rows();
  const auto sessions = RowsOf(rows, Table::kLivoSession);
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(*Field(Json(sessions[0].session_info), "SessionID"), Value(42));
  const Value user_info = Json(sessions[0].user_info);
  EXPECT_EQ(*Field(user_info, "ServiceName"), Value("telephony_session"));
  EXPECT_EQ(*Field(user_info, "HostApplicationDisplayID"), Value("com.example.app"));
  EXPECT_TRUE(sessions[0].flushed);

  std::vector<std::int64_t> categories;
  std::vector<Value> payloads;
  for (const auto& row : RowsOf(rows, Table::kLivoMessage)) {
    ASSERT_EQ(row.session, sessions[0].id) << "no single messages expected";
    categories.push_back(row.category);
    payloads.push_back(Json(row.payload));
  }
  // The two messages, the driver statistics delta, then the summary event.
  ASSERT_THAT(categories, ElementsAre(5, 11, 9, 0xFFFF));
  EXPECT_EQ(payloads[0], Value(Dictionary{{"route", "speaker"}}));
  EXPECT_EQ(payloads[1], Value(Dictionary{{"two_words", 1}}));
  EXPECT_EQ(payloads[2], Value(Dictionary{{"Speaker_frames", 15}}));
  EXPECT_TRUE(Field(payloads[3], "QN_Session_Summary_Event"));

  for (const char* name : {"com.norvel.quenta.Setup.Start", "com.norvel.quenta.Volume.Stop",
                           "com.norvel.quenta.Ostreling.Generic"}) {
    auto events = AnalyticsNamed(rows, name);
    ASSERT_EQ(events.size(), 1u) << name;
    EXPECT_EQ(*Field(Json(events[0].payload), "HostApplicationDisplayID"),
              Value("com.example.app"));
  }
  auto uptime = AnalyticsNamed(rows, "com.norvel.quenta.qnreportingclientuptime");
  ASSERT_EQ(uptime.size(), 2u);  // the readiness probe, then this client
  const Value uptime_payload = Json(uptime[1].payload);
  EXPECT_EQ(*Field(uptime_payload, "processName"), Value(OwnCommandName()));
  ASSERT_TRUE(Field(uptime_payload, "seconds"));
  EXPECT_GE(Field(uptime_payload, "seconds")->as_double().value_or(-1), 0.0);
}

TEST(SessionFlowTest, BroadcastWithoutAStartedSessionIsOneStandaloneMessage) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto client = daemon.Connect();
  ASSERT_TRUE(client);
  EXPECT_EQ(client->createReportingSessionSync(5), true);  // created, never started
  EXPECT_TRUE(RepliedWithoutError(
      client->sendMessageSync(Value(Dictionary{{"k", "v"}}), 5, 1, std::nullopt)));

  // The standalone message is sent from the background queue after the reply.
  ASSERT_TRUE(daemon.WaitForRows(
      [](const auto& rows) { return !RowsOf(rows, Table::kLivoMessage).empty(); }));
  client.reset();
  EXPECT_EQ(daemon.Stop(), Exited(0));
  const auto rows = daemon.Rows();
  const auto messages = RowsOf(rows, Table::kLivoMessage);
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_FALSE(messages[0].session);
  EXPECT_EQ(messages[0].category, 5);
  EXPECT_EQ(messages[0].type, 1);
  EXPECT_EQ(*Field(Json(messages[0].user_info), "ServiceName"), Value("standalone"));
  EXPECT_TRUE(RowsOf(rows, Table::kLivoSession).empty());
  // The analytics bridge is not called for standalone messages.
  for (const auto& row : RowsOf(rows, Table::kAnalyticsEvent)) {
    EXPECT_EQ(row.name, "com.norvel.quenta.qnreportingclientuptime");
  }
}

}  // namespace
}  // namespace qn::e2e
