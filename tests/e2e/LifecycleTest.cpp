// The daemon's life: clients leaving, killService, signals, the command line.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using ::testing::HasSubstr;
using Table = ReportingStoreRow::Table;

constexpr const char* kUptimeEvent = "com.norvel.quenta.qnreportingclientuptime";

std::vector<std::int64_t> Categories(const std::vector<ReportingStoreRow>& rows) {
  std::vector<std::int64_t> out;
  for (const auto& row : RowsOf(rows, Table::kLivoMessage)) out.push_back(row.category);
  return out;
}

TEST(LifecycleTest, ALeavingClientsSessionsStopAndUptimeIsSent) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto leaving = daemon.Connect();
  auto staying = daemon.Connect();
  ASSERT_TRUE(leaving && staying);
  EXPECT_EQ(leaving->createReportingSessionSync(1), true);
  EXPECT_EQ(leaving->createReportingSessionSync(2), true);
  bool start_replied = false;
  leaving->startReportingSessionForID(1, [&](bool) { start_replied = true; });
  EXPECT_TRUE(RepliedWithoutError(
      leaving->sendMessageSync(Value(Dictionary{{"a", 1}}), 3, 1, std::vector<std::int64_t>{1})));
  leaving.reset();  // closes the connection; the start reply never came
  EXPECT_FALSE(start_replied);

  // The removal runs on the server queue after the connection ended.
  std::vector<std::int64_t> reporters{-1};
  for (auto deadline = std::chrono::steady_clock::now() + kPatience;
       !reporters.empty() && std::chrono::steady_clock::now() < deadline;) {
    reporters = staying->getAllReportersSync().value_or(std::vector<std::int64_t>{-1});
  }
  EXPECT_TRUE(reporters.empty());
  // The stopped session's summary event reaches the store.
  ASSERT_TRUE(daemon.WaitForRows([](const auto& rows) {
    auto categories = Categories(rows);
    return std::find(categories.begin(), categories.end(), 0xFFFF) != categories.end();
  }));
  staying.reset();
  EXPECT_EQ(daemon.Stop(), Exited(0));

  const auto rows = daemon.Rows();
  EXPECT_EQ(Categories(rows), (std::vector<std::int64_t>{3, 0xFFFF}));
  const auto sessions = RowsOf(rows, Table::kLivoSession);
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_TRUE(sessions[0].flushed);
  EXPECT_EQ(AnalyticsNamed(rows, kUptimeEvent).size(), 3u);  // the probe and both clients
}

TEST(LifecycleTest, KillServiceExitsTwoAndTheStoreKeepsAll) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto killer = daemon.Connect();
  auto bystander = daemon.Connect();
  ASSERT_TRUE(killer && bystander);
  EXPECT_EQ(killer->createReportingSessionSync(42), true);
  EXPECT_EQ(killer->setServiceTypeSync(3, 42), true);
  killer->startReportingSessionForID(42, nullptr);
  // Both bridges hand their events to the store before the reply.
  EXPECT_TRUE(RepliedWithoutError(killer->sendMessageSync(
      Value(Dictionary{{"EngineOnTime", 2.5}, {"qnreporting_timestamp", 1700000000}}), 5, 6,
      std::vector<std::int64_t>{42})));

  killer->killService();
  EXPECT_EQ(daemon.process().Wait(), Exited(2));
  EXPECT_TRUE(bystander->WaitUntilEnded());
  EXPECT_THAT(daemon.process().Stderr(), HasSubstr(": DESTROYING SERVICE"));

  const auto rows = daemon.Rows();
  EXPECT_EQ(AnalyticsNamed(rows, "com.norvel.quenta.Setup.Undefined").size(), 1u);
  auto power = RowsOf(rows, Table::kPowerLogEvent);
  ASSERT_EQ(power.size(), 1u);
  EXPECT_EQ(power[0].name, "Vistrel_Haptics");
  EXPECT_EQ(power[0].subsystem, 28);
  // Nothing was stopped on the way out: only the readiness probe had left.
  EXPECT_EQ(AnalyticsNamed(rows, kUptimeEvent).size(), 1u);
  for (auto category : Categories(rows)) EXPECT_NE(category, 0xFFFF);
}

TEST(LifecycleTest, SigtermStopsEverySessionWritesTheStoreAndExitsWithZero) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto client = daemon.Connect();
  ASSERT_TRUE(client);
  for (std::int64_t id : {1, 2, 3}) {
    EXPECT_EQ(client->createReportingSessionSync(id), true);
    client->startReportingSessionForID(id, nullptr);
    EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"n", id}}), 1, 1,
                                                            std::vector<std::int64_t>{id})));
  }
  EXPECT_EQ(daemon.Stop(SIGTERM), Exited(0));
  EXPECT_TRUE(client->WaitUntilEnded());
  EXPECT_FALSE(std::filesystem::exists(daemon.socket_path()));

  const auto rows = daemon.Rows();
  const auto sessions = RowsOf(rows, Table::kLivoSession);
  ASSERT_EQ(sessions.size(), 3u);
  for (const auto& session : sessions) EXPECT_TRUE(session.flushed);
  int summaries = 0;
  for (auto category : Categories(rows)) summaries += category == 0xFFFF;
  EXPECT_EQ(summaries, 3);
  EXPECT_EQ(AnalyticsNamed(rows, kUptimeEvent).size(), 2u);  // the probe and the client
}

TEST(LifecycleTest, SighupReReadsTheDefaults) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto client = daemon.Connect();
  ASSERT_TRUE(client);
  const std::string defaults = daemon.home() + "/state/defaults";
  std::filesystem::create_directories(defaults);
  std::ofstream(defaults + "/com.norvel.quenta.json.tmp") << R"({"disable_reporting": true})";
  std::filesystem::rename(defaults + "/com.norvel.quenta.json.tmp",
                          defaults + "/com.norvel.quenta.json");
  // Read only when told to.
  EXPECT_TRUE(RepliedWithoutError(
      client->sendMessageSync(Value(Dictionary{}), 1, 1, std::vector<std::int64_t>{})));

  daemon.process().Signal(SIGHUP);
  std::optional<std::optional<client::ReplyError>> result;
  for (auto deadline = std::chrono::steady_clock::now() + kPatience;
       std::chrono::steady_clock::now() < deadline;) {
    result = client->sendMessageSync(Value(Dictionary{}), 1, 1, std::vector<std::int64_t>{});
    if (result && *result) break;
  }
  ASSERT_TRUE(result && *result);
  EXPECT_EQ((*result)->domain, "com.norvel.audio.reporting");
  EXPECT_EQ((*result)->code, 1);
  EXPECT_TRUE((*result)->userInfo.is_null());
  EXPECT_TRUE(daemon.process().running());
}

TEST(CommandLineTest, HelpVersionAndBadArguments) {
  testing::TempDir dir;
  {
    ChildProcess help(QN_DAEMON_PATH, {"--help"}, dir.path());
    EXPECT_EQ(help.Wait(), Exited(0));
    for (const char* flag : {"--home DIR", "--socket PATH", "--internal-build",
                             "--device-info FILE", "--driver-stats DIR", "--debug SCOPES"}) {
      EXPECT_THAT(help.Stdout(), HasSubstr(flag));
    }
  }
  {
    ChildProcess version(QN_DAEMON_PATH, {"--version"}, dir.path());
    EXPECT_EQ(version.Wait(), Exited(0));
    EXPECT_THAT(version.Stdout(), HasSubstr("qnreportingd "));
  }
  for (const std::vector<std::string>& args : {std::vector<std::string>{"--bogus"},
                                               {"--home"},
                                               {"--home="},
                                               {"--internal-build=1"},
                                               {"stray"}}) {
    ChildProcess bad(QN_DAEMON_PATH, args, dir.path());
    EXPECT_EQ(bad.Wait(), Exited(2)) << args[0];
    EXPECT_THAT(bad.Stderr(), HasSubstr("qnreportingd: ")) << args[0];
    EXPECT_THAT(bad.Stderr(), HasSubstr("--help")) << args[0];
  }
}

}  // namespace
}  // namespace qn::e2e
