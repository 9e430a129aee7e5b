// qnreport: the command line in-process on a temporary home (usage errors, defaults, notify,
// events, session), the shell's line parser, and the shell against an in-process listener.
#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "common/Json.h"
#include "platform/linux/reporting_store.h"
#include "tests/ipc/ipc_test_util.h"
#include "tools/qnreport/Admin.h"
#include "tools/qnreport/Cli.h"
#include "tools/qnreport/Commands.h"
#include "tools/qnreport/Shell.h"

namespace qn::qnreport {
namespace {

class CommandLineTest : public ::testing::Test {
 protected:
  int Run(std::vector<std::string> args) {
    args.insert(args.begin(), {"--home", home_.path()});
    out_.str("");
    err_.str("");
    std::istringstream in;
    return RunCommandLine(args, in, out_, err_);
  }
  Value JsonOut() {
    Value value;
    EXPECT_FALSE(ParseJson(out_.str(), value).has_value()) << out_.str();
    return value;
  }
  Paths paths() const { return ResolvePaths(PathOptions{home_.path(), std::nullopt}); }

  testing::TempDir home_;
  std::ostringstream out_, err_;
};

TEST_F(CommandLineTest, UsageErrorsExitTwoAndSayWhatIsWrong) {
  const std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
      {{}, "missing command"},
      {{"bogus"}, "bogus"},
      {{"defaults"}, "subcommand"},
      {{"defaults", "write", "only_key"}, "VALUE"},
      {{"notify", "post"}, "NAME"},
      {{"events", "--sink", "elsewhere"}, "--sink"},
      {{"events", "--since", "soonish"}, "not a time"},
      {{"--timeout", "0", "valid", "1"}, "positive number"},
      {{"create", "abc"}, "not a 64-bit integer"},
      {{"send", "{}", "5", "70000"}, "type"},
      {{"session"}, "N"}};
  for (const auto& [args, problem] : cases) {
    EXPECT_EQ(Run(args), 2) << ::testing::PrintToString(args);
    EXPECT_NE(err_.str().find(problem), std::string::npos) << err_.str();
    EXPECT_NE(err_.str().find("--help"), std::string::npos) << err_.str();
  }
  EXPECT_EQ(Run({"events", "--help"}), 0);
  EXPECT_NE(out_.str().find("--follow"), std::string::npos);
}

// defaults: values as JSON or plain strings, read back and deleted; notify post touches the
// notification file (when anyone ever watched).
TEST_F(CommandLineTest, DefaultsAndNotify) {
  EXPECT_EQ(Run({"defaults", "write", "disable_reporting", "YES"}), 0) << err_.str();
  EXPECT_EQ(Run({"defaults", "write", "device_name", "\"lab phone\""}), 0);
  EXPECT_EQ(Run({"defaults", "write", "level", "3"}), 0);
  ASSERT_EQ(Run({"defaults", "read"}), 0);
  EXPECT_EQ(
      JsonOut(),
      Value(Dictionary{{"disable_reporting", "YES"}, {"device_name", "lab phone"}, {"level", 3}}));
  EXPECT_EQ(Run({"defaults", "delete", "disable_reporting"}), 0);
  EXPECT_EQ(Run({"defaults", "delete", "never_there"}), 0);
  ASSERT_EQ(Run({"defaults", "read"}), 0);
  EXPECT_FALSE(JsonOut().as_dictionary()->Contains("disable_reporting"));

  const std::string file = paths().runtime_dir + "/notify/com.norvel.quenta.reporting";
  // Nobody has ever watched: nobody to tell, and nothing is created.
  EXPECT_EQ(Run({"notify", "post", "com.norvel.quenta.reporting"}), 0) << err_.str();
  EXPECT_FALSE(std::filesystem::exists(file));
  std::filesystem::create_directories(paths().runtime_dir + "/notify");
  EXPECT_EQ(Run({"notify", "post", "com.norvel.quenta.reporting"}), 0) << err_.str();
  EXPECT_TRUE(std::filesystem::exists(file));
  EXPECT_EQ(Run({"notify", "post", "../escape"}), 1);  // would leave the notification folder
}

// events filtered by sink, session and time; session tells one session's story.
TEST_F(CommandLineTest, EventsAndSession) {
  EXPECT_EQ(Run({"events"}), 1);
  EXPECT_NE(err_.str().find("reports.db"), std::string::npos);
  // A store with one stopped framework session (number 1), a single message, a power-log row.
  std::filesystem::create_directories(paths().state_dir);
  std::optional<Error> error;
  auto store = ReportingStore::Open(paths().state_dir + "/reports.db", nullptr, &error);
  ASSERT_TRUE(store);
  const std::int64_t id = store->NewSessionId();
  store->AddSession(id, Value(Dictionary{{"SessionID", 42}}),
                    Value(Dictionary{{"ServiceName", "alarm_session"}}));
  for (int type : {1, 1, 2}) store->AddSessionMessage(id, 5, type, Value(Dictionary{{"a", type}}));
  store->AddSessionMessage(id, 0xFFFF, 0xFFFF, Value(Dictionary{{"a", "1,1,2"}}));
  store->MarkSessionFlushed(id, nullptr);
  store->AddSingleMessage(Value(Dictionary{}), Value(Dictionary{}), 5, 1,
                          Value(Dictionary{{"route", "speaker"}}));
  store->AddPowerLogEvent(28, "Vistrel_Haptics", Value(Dictionary{{"EngineOnDuration", 2}}));
  store->Drain();

  ASSERT_EQ(Run({"events"}), 0) << err_.str();
  EXPECT_NE(out_.str().find("reporting  single   5 Setup             1 Start         "
                            "{\"route\":\"speaker\"}"),
            std::string::npos)
      << out_.str();
  EXPECT_NE(out_.str().find("Vistrel_Haptics"), std::string::npos);

  ASSERT_EQ(Run({"events", "--sink", "powerlog", "--json"}), 0);
  EXPECT_EQ(*JsonOut().as_dictionary()->Find("name"), Value("Vistrel_Haptics"));

  const std::vector<std::pair<std::vector<std::string>, int>> counts = {
      {{}, 7},
      {{"--session", "1"}, 5},
      {{"--session", "2"}, 0},
      {{"--since", "-1h"}, 7},
      {{"--since", "-1h", "--sink", "reporting"}, 6},
      {{"--since", "4000000000"}, 0}};
  for (auto [args, rows] : counts) {
    args.insert(args.begin(), {"events", "--json"});
    ASSERT_EQ(Run(args), 0) << err_.str();
    const std::string text = out_.str();
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), rows)
        << ::testing::PrintToString(args) << out_.str();
  }

  ASSERT_EQ(Run({"session", "1"}), 0) << err_.str();
  const std::string story = out_.str();
  for (const char* line : {"Session 1: reporter 42, alarm_session, unknown\n", "  messages  4\n",
                           "    5 Setup               1 Start           2\n",
                           "    5 Setup               2 Stop            1\n",
                           "  summary   {\"a\":\"1,1,2\"}\n", "  drivers   no driver"}) {
    EXPECT_NE(story.find(line), std::string::npos) << line << " in\n" << story;
  }
  EXPECT_EQ(story.find("stopped   not yet"), std::string::npos) << story;
  EXPECT_EQ(Run({"session", "2"}), 1);
  EXPECT_NE(err_.str().find("no session 2"), std::string::npos);
}

// stats: one line when no daemon runs (no file, or one left by a process that has ended);
// a running daemon's file as it is, ended with a newline like every command's output.
TEST_F(CommandLineTest, StatsOfARunningDaemonOrOneLineWhyNot) {
  const std::string file = paths().runtime_dir + "/stats.json";
  const std::string alive = "{\"pid\":" + std::to_string(getpid()) + ",\"messages\":3}";
  const struct {
    std::optional<std::string> text;
    std::vector<std::string> args;
    int status;
    std::string out, err;
  } cases[] = {
      {std::nullopt, {"stats"}, 1, "", "qnreport: qnreportingd is not running (there is no "},
      {R"({"pid":99999999})", {"stats"}, 1, "", "is from process 99999999, which has ended)\n"},
      {"[1]", {"stats"}, 1, "", "is not a stats file\n"},
      {alive, {"stats", "--json"}, 0, alive + "\n", ""},
      {alive, {"stats"}, 0, "messages  3\nstatus: 0 connections", ""},
  };
  std::filesystem::create_directories(paths().runtime_dir);
  for (const auto& c : cases) {
    std::filesystem::remove(file);
    if (c.text) std::ofstream(file) << *c.text;
    EXPECT_EQ(Run(c.args), c.status) << c.text.value_or("no file");
    const std::string out = out_.str(), err = err_.str();
    EXPECT_NE(out.find(c.out), std::string::npos) << out;
    EXPECT_NE(err.find(c.err), std::string::npos) << err;
    EXPECT_EQ(std::count(err.begin(), err.end(), '\n'), c.status) << err;
  }
}

TEST(QnreportParseTest, BadLinesAndTimes) {
  const std::pair<const char*, const char*> cases[] = {
      {"frobnicate 1", "unknown command \"frobnicate\""},
      {"create", "missing reporter ID"},
      {"create 9223372036854775808", "not a 64-bit integer"},
      {"type 1 65536", "16-bit"},
      {"create 1 2", "unexpected \"2\""},
      {"config 1 {\"a\":", "JSON object"},
      {"config 1 [1]", "not an array"},
      {"config 1 {\"a\" 1}", "not valid JSON"},
      {"send {} 4294967296 1", "32-bit"},
      {"send {} 1 1 1,x", "bad reporter ID \"x\""},
      {"send {} 1", "usage"},
      {"sleep -1", "seconds"}};
  for (const auto& [line, problem] : cases) {
    auto result = ParseCommand(line);
    auto* text = std::get_if<std::string>(&result);
    ASSERT_TRUE(text) << line << " was accepted";
    EXPECT_NE(text->find(problem), std::string::npos) << line << ": " << *text;
  }
  // Times for events --since.
  const double now = 1'800'000'000;
  EXPECT_EQ(ParseTimeArgument("-90s", now), now - 90);
  EXPECT_EQ(ParseTimeArgument("-2h", now), now - 7200);
  EXPECT_EQ(ParseTimeArgument("1700000000.5", now), 1700000000.5);
  EXPECT_TRUE(ParseTimeArgument("2026-11-21 13:05", now));
  for (const char* bad : {"", "-", "-5y", "yesterdayish", "2026-13-45 99:99"}) {
    EXPECT_FALSE(ParseTimeArgument(bad, now)) << bad;
  }
}

TEST(QnreportShellTest, OneConnectionEveryReplyAsAJsonLine) {
  testing::ListenerHarness harness([](protocol::Op op, const Array& args, IpcReply reply) {
    if (op == protocol::Op::kGetServiceNameForReporterID && args[0] == Value(0)) {
      reply(Value(65535));
    }
    testing::FakeExportedObject::DefaultReply(op, args, reply);
  });
  std::ostringstream out;  // outlives the client, whose late replies may still print to it
  auto client = client::Client::Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::istringstream in(
      "create 42\ntype 42 2\nbogus\nname 0\nsend {\"route\": \"speaker\"} 5 1 42\nwait\n"
      "valid 42\nreporters\n");
  EXPECT_EQ(RunShell(*client, in, out, std::chrono::seconds(20)), 0);
  // The error line is printed when its line is read; the replies when they arrive.
  std::istringstream printed(out.str());
  std::string line, replies;
  int errors = 0;
  while (std::getline(printed, line)) {
    Value value;
    ASSERT_FALSE(ParseJson(line, value)) << line;
    const bool error = value.as_dictionary()->Contains("error");
    errors += error && *value.as_dictionary()->Find("line") == Value(3);
    if (!error) replies += line + "\n";
  }
  EXPECT_EQ(errors, 1) << out.str();
  EXPECT_EQ(replies,
            R"({"op":"create","id":42,"reply":true}
{"op":"type","id":42,"reply":true}
{"op":"name","id":0,"reply":65535}
{"op":"name","id":0,"reply":0}
{"op":"send","reply":null}
{"op":"valid","id":42,"reply":{"reporterID":42,"serviceType":7}}
{"op":"reporters","reply":[1,2,3]}
)");
  EXPECT_EQ(harness.delegate().accepted().size(), 1u);  // one connection served all of it
}

}  // namespace
}  // namespace qn::qnreport
