// The daemon end to end through the real client library: a session's flow into the store
// and its summary file, clients leaving, killService, signals, the command line.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <string>
#include <vector>

#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using ::testing::AllOf;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using Table = ReportingStoreRow::Table;

constexpr const char* kUptimeEvent = "com.norvel.quenta.qnreportingclientuptime";

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

std::vector<std::int64_t> Categories(const std::vector<ReportingStoreRow>& rows) {
  std::vector<std::int64_t> out;
  for (const auto& row : RowsOf(rows, Table::kLivoMessage)) out.push_back(row.category);
  return out;
}

// One session from create to destroy on an internal build, after a broadcast that found no
// started session (a standalone message): the rows in the store, the summary file in place
// when the stop reply arrives (a stale temporary file of an earlier run gone).
TEST(SessionFlowTest, WholeSessionLandsInTheStore) {
  testing::TempDir stats, home;
  const std::string counter = stats.path() + "/Speaker/Main/frames";
  WriteCounter(counter, 10);  // the daemon subscribes to its drivers at start-up
  const std::string summaries = home.File("log/DiagnosticLogs/Audio/Reporting");
  std::filesystem::create_directories(summaries);
  std::ofstream(summaries + "/.20240101-000000+0000-quenta-unknown-generic.json.tmp-7-0-1f") << "[";
  auto started = StartOn(home, {"--driver-stats", stats.path(), "--internal-build"});
  Daemon& daemon = *started;
  ASSERT_TRUE(daemon.started());
  // A client whose command name holds a newline: it shows escaped in the uptime line and
  // row, never as a line of its own.
  const std::string own_name = OwnCommandName();
  prctl(PR_SET_NAME, "e2e\nFAKE: line");
  auto client = daemon.Connect();
  ASSERT_TRUE(client);
  EXPECT_TRUE(RepliedWithoutError(
      client->sendMessageSync(Value(Dictionary{{"k", "v"}}), 5, 1, std::nullopt)));
  prctl(PR_SET_NAME, own_name.c_str());  // the name was read before that reply

  EXPECT_EQ(client->createReportingSessionSync(42), true);
  EXPECT_EQ(client->setServiceTypeSync(2, 42), true);
  EXPECT_EQ(client->setConfigurationSync(
                Value(Dictionary{{"HostApplicationDisplayID", "com.example.app"}}), 42),
            true);
  std::mutex mu;
  std::vector<std::string> order;  // each reply with the summary files there when it came
  auto record = [&](std::string reply) {
    return [&, reply](bool ok) {
      std::lock_guard lock(mu);
      order.push_back(reply + (ok ? " YES " : " NO ") + std::to_string(NamesIn(summaries).size()));
    };
  };
  client->startReportingSessionForID(42, record("start"));
  EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"route", "speaker"}}),
                                                          5, 1, std::vector<std::int64_t>{42})));
  EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"two words", 1}}), 11,
                                                          2, std::vector<std::int64_t>{42})));
  {
    std::lock_guard lock(mu);
    EXPECT_TRUE(order.empty()) << "the start reply waits for the stop";
  }
  WriteCounter(counter, 25);
  client->stopReportingSessionForID(42, record("stop"));
  ASSERT_TRUE(client->WaitForReplies());
  {
    std::lock_guard lock(mu);
    EXPECT_THAT(order, ElementsAre("start YES 1", "stop YES 1"));
  }
  const auto files = NamesIn(summaries);
  ASSERT_EQ(files.size(), 1u);
  EXPECT_TRUE(files[0].ends_with("-quenta-com.example.app-telephony.json")) << files[0];
  const Value summary = Json(testing::ReadFileText(summaries + "/" + files[0]));
  ASSERT_TRUE(summary.as_array());
  EXPECT_EQ(summary.as_array()->size(), 5u);  // user info, two messages, drivers, the summary
  EXPECT_EQ(client->destroyReportingSessionSync(42), true);
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
  auto messages = RowsOf(rows, Table::kLivoMessage);
  ASSERT_EQ(messages.size(), 5u);
  EXPECT_FALSE(messages[0].session);  // the standalone message
  EXPECT_EQ(*Field(Json(messages[0].user_info), "ServiceName"), Value("standalone"));
  for (const auto& row : messages) {
    EXPECT_EQ(row.session, row.session ? sessions[0].id : row.session);
    categories.push_back(row.category);
    payloads.push_back(Json(row.payload));
  }
  // The two messages, the driver statistics delta, then the summary event.
  ASSERT_THAT(categories, ElementsAre(5, 5, 11, 9, 0xFFFF));
  EXPECT_EQ(payloads[1], Value(Dictionary{{"route", "speaker"}}));
  EXPECT_EQ(payloads[2], Value(Dictionary{{"two_words", 1}}));
  EXPECT_EQ(payloads[3], Value(Dictionary{{"Speaker_frames", 15}}));
  EXPECT_TRUE(Field(payloads[4], "QN_Session_Summary_Event"));

  // The analytics bridge saw the session's messages only, not the standalone one.
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
  EXPECT_EQ(*Field(uptime_payload, "processName"), Value("e2e\\nFAKE: line"));
  EXPECT_THAT(daemon.process().Stderr(), AllOf(HasSubstr(" process=e2e\\nFAKE: line uptime_sec="),
                                               Not(HasSubstr("\nFAKE: line"))));
  ASSERT_TRUE(Field(uptime_payload, "seconds"));
  EXPECT_GE(Field(uptime_payload, "seconds")->as_double().value_or(-1), 0.0);
}

// killService: exit status 2; what the store was handed is kept, and so are the summary files
// of the sessions stopped and destroyed right before.
TEST(LifecycleTest, KillServiceExitsTwoAndTheStoreKeepsAll) {
  Daemon daemon({"--internal-build"});
  ASSERT_TRUE(daemon.started());
  auto killer = daemon.Connect();
  auto bystander = daemon.Connect();
  ASSERT_TRUE(killer && bystander);
  EXPECT_EQ(killer->createReportingSessionSync(42), true);
  EXPECT_EQ(killer->setServiceTypeSync(3, 42), true);
  killer->startReportingSessionForID(42, nullptr);
  const Value message(Dictionary{{"EngineOnTime", 2.5}, {"qnreporting_timestamp", 1700000000}});
  EXPECT_TRUE(RepliedWithoutError(killer->sendMessageSync(message, 5, 6, {{42}})));
  EXPECT_EQ(killer->stopReportingSessionForIDSync(42), true);
  // A started session destroyed: its file is in place at the reply (its start reply never
  // comes); without a host application the file is named "unknown".
  const std::string summaries = daemon.home() + "/log/DiagnosticLogs/Audio/Reporting";
  EXPECT_EQ(killer->createReportingSessionSync(43), true);
  EXPECT_EQ(killer->setServiceTypeSync(0, 43), true);
  killer->startReportingSessionForID(43, nullptr);
  EXPECT_TRUE(
      RepliedWithoutError(killer->sendMessageSync(Value(Dictionary{{"n", 1}}), 1, 0, {{43}})));
  auto at_destroy = std::make_shared<std::promise<std::vector<std::string>>>();
  auto files = at_destroy->get_future();
  killer->destroyReportingSession(
      43, [at_destroy, summaries](bool) { at_destroy->set_value(NamesIn(summaries)); });
  ASSERT_EQ(files.wait_for(kPatience), std::future_status::ready);
  EXPECT_THAT(files.get(), Contains(EndsWith("-quenta-unknown-generic.json")));
  // Both bridges hand their events to the store on the server queue. The reply to the last
  // message comes once every earlier one is handed over; the kill right after it must not
  // lose what the store has not written yet.
  constexpr std::size_t kMessages = 2001;
  for (std::size_t n = 1; n + 1 < kMessages; ++n) {
    killer->sendMessage(Value(Dictionary{{"EngineOnTime", 2.5}, {"qnreporting_timestamp", n}}), 5,
                        6, std::vector<std::int64_t>{42}, nullptr);
  }
  EXPECT_TRUE(RepliedWithoutError(killer->sendMessageSync(message, 5, 6, {{42}})));
  killer->killService();
  EXPECT_EQ(daemon.process().Wait(), Exited(2));
  EXPECT_EQ(NamesIn(summaries).size(), 2u);
  EXPECT_TRUE(bystander->WaitUntilEnded());
  EXPECT_THAT(daemon.process().Stderr(), HasSubstr(": DESTROYING SERVICE"));

  const auto rows = daemon.Rows();
  EXPECT_EQ(AnalyticsNamed(rows, "com.norvel.quenta.Setup.Undefined").size(), kMessages);
  auto power = RowsOf(rows, Table::kPowerLogEvent);
  ASSERT_EQ(power.size(), kMessages);
  EXPECT_EQ(power[0].name, "Vistrel_Haptics");
  EXPECT_EQ(power[0].subsystem, 28);
  // The exit stops nothing: only the readiness probe had left.
  EXPECT_EQ(AnalyticsNamed(rows, kUptimeEvent).size(), 1u);
}

// A client that leaves has its sessions stopped (its start reply never comes); SIGHUP
// re-reads the defaults (written here, read only when told); SIGTERM stops every session
// left, writes the store and exits with 0.
TEST(LifecycleTest, LeavingClientsSighupAndSigterm) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto leaving = daemon.Connect();
  auto client = daemon.Connect();
  ASSERT_TRUE(leaving && client);
  EXPECT_EQ(leaving->createReportingSessionSync(7), true);
  bool start_replied = false;
  leaving->startReportingSessionForID(7, [&](bool) { start_replied = true; });
  EXPECT_TRUE(RepliedWithoutError(
      leaving->sendMessageSync(Value(Dictionary{{"a", 1}}), 3, 1, std::vector<std::int64_t>{7})));
  leaving.reset();
  EXPECT_FALSE(start_replied);
  // The removal runs on the server queue after the connection ended.
  EXPECT_TRUE(
      Eventually([&] { return client->getAllReportersSync() == std::vector<std::int64_t>{}; }));
  ASSERT_TRUE(daemon.WaitForRows([](const auto& rows) {
    return Categories(rows) == std::vector<std::int64_t>{3, 0xFFFF};
  }));

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
  ASSERT_TRUE(Eventually([&] { return (refused = send()) && *refused; }));
  EXPECT_EQ((*refused)->domain, "com.norvel.audio.reporting");
  EXPECT_EQ((*refused)->code, 1);
  EXPECT_TRUE((*refused)->userInfo.is_null());

  EXPECT_EQ(daemon.Stop(SIGTERM), Exited(0));
  EXPECT_TRUE(client->WaitUntilEnded());
  EXPECT_FALSE(std::filesystem::exists(daemon.socket_path()));
  const auto rows = daemon.Rows();
  const auto sessions = RowsOf(rows, Table::kLivoSession);
  ASSERT_EQ(sessions.size(), 4u);
  for (const auto& session : sessions) EXPECT_TRUE(session.flushed);
  const auto categories = Categories(rows);
  EXPECT_EQ(std::count(categories.begin(), categories.end(), 0xFFFF), 4);
  EXPECT_EQ(AnalyticsNamed(rows, kUptimeEvent).size(), 3u);  // the probe and both clients
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

// A runtime folder that is not the daemon's own (another user's, or one others may write
// to) could hand the socket to someone else: the daemon refuses it and exits with 1.
TEST(CommandLineTest, ARuntimeFolderNotPrivateExitsOne) {
  const struct {
    const char* what;
    uid_t owner;
    std::filesystem::perms mode;
  } cases[] = {
      {"another user's", 65534, std::filesystem::perms::owner_all},
      {"writable by others", geteuid(), std::filesystem::perms::all},
  };
  for (const auto& c : cases) {
    if (c.owner != geteuid() && geteuid() != 0) continue;  // only root can give a folder away
    testing::TempDir home;
    const std::string run = home.File("run");
    std::filesystem::create_directories(run);
    std::filesystem::permissions(run, c.mode);
    ASSERT_EQ(chown(run.c_str(), c.owner, static_cast<gid_t>(-1)), 0);
    ChildProcess process(QN_DAEMON_PATH, {"--home", home.path()}, home.path());
    EXPECT_EQ(process.Wait(), Exited(1)) << c.what;
    EXPECT_THAT(process.Stderr(), HasSubstr("qnreportingd: refusing the folder " + run)) << c.what;
    EXPECT_FALSE(std::filesystem::exists(run + "/reporting.sock")) << c.what;
  }
}

}  // namespace
}  // namespace qn::e2e
