// The daemon's life: clients leaving, killService, signals, the command line.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
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

// SIGHUP re-reads the defaults (written here, read only when told); SIGTERM then stops every
// session, writes the store and exits with 0.
TEST(LifecycleTest, SighupReReadsTheDefaultsSigtermStopsEverySessionAndExitsWithZero) {
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
  const std::string defaults = daemon.home() + "/state/defaults";
  std::filesystem::create_directories(defaults);
  std::ofstream(defaults + "/com.norvel.quenta.json.tmp") << R"({"disable_reporting": true})";
  std::filesystem::rename(defaults + "/com.norvel.quenta.json.tmp",
                          defaults + "/com.norvel.quenta.json");
  auto send = [&] { return client->sendMessageSync(Value(Dictionary{}), 1, 1, {{1}}); };
  EXPECT_TRUE(RepliedWithoutError(send()));
  daemon.process().Signal(SIGHUP);
  std::optional<std::optional<client::ReplyError>> refused;
  for (auto deadline = std::chrono::steady_clock::now() + kPatience;
       !(refused && *refused) && std::chrono::steady_clock::now() < deadline;) {
    refused = send();
  }
  ASSERT_TRUE(refused && *refused);
  EXPECT_EQ((*refused)->domain, "com.norvel.audio.reporting");
  EXPECT_EQ((*refused)->code, 1);
  EXPECT_TRUE((*refused)->userInfo.is_null());

  EXPECT_EQ(daemon.Stop(SIGTERM), Exited(0));
  EXPECT_TRUE(client->WaitUntilEnded());
  EXPECT_FALSE(std::filesystem::exists(daemon.socket_path()));
  const auto rows = daemon.Rows();
  const auto sessions = RowsOf(rows, Table::kLivoSession);
  ASSERT_EQ(sessions.size(), 3u);
  for (const auto& session : sessions) EXPECT_TRUE(session.flushed);
  const auto categories = Categories(rows);
  EXPECT_EQ(std::count(categories.begin(), categories.end(), 0xFFFF), 3);
  EXPECT_EQ(AnalyticsNamed(rows, kUptimeEvent).size(), 2u);  // the probe and the client
}

// CLI11 does the parsing; this pins the exit codes a service manager sees.
TEST(CommandLineTest, HelpExitsZeroBadArgumentsExitTwo) {
  testing::TempDir dir;
  ChildProcess help(QN_DAEMON_PATH, {"--help"}, dir.path());
  EXPECT_EQ(help.Wait(), Exited(0));
  EXPECT_THAT(help.Stdout(), HasSubstr("--home DIR"));
  for (const char* bad : {"--bogus", "--home"}) {
    ChildProcess process(QN_DAEMON_PATH, {bad}, dir.path());
    EXPECT_EQ(process.Wait(), Exited(2)) << bad;
    EXPECT_THAT(process.Stderr(), HasSubstr("qnreportingd: ")) << bad;
  }
}

}  // namespace
}  // namespace qn::e2e
