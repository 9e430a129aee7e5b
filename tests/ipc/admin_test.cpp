// qnreport's command line in-process: usage errors, defaults, notify, events and session on
// a temporary home (the operations that need a daemon are covered by the shell tests).
#include <gtest/gtest.h>

#include <filesystem>
#include <sstream>

#include "common/Json.h"
#include "platform/linux/reporting_store.h"
#include "tests/fakes/TempDir.h"
#include "tools/qnreport/Admin.h"
#include "tools/qnreport/Cli.h"

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
  // A store with one stopped framework session (number 1), a single message, a power-log row.
  void FillStore() {
    std::filesystem::create_directories(paths().state_dir);
    std::optional<Error> error;
    auto store = ReportingStore::Open(paths().state_dir + "/reports.db", nullptr, &error);
    ASSERT_TRUE(store);
    const std::int64_t id = store->NewSessionId();
    store->AddSession(id, Value(Dictionary{{"SessionID", 42}}),
                      Value(Dictionary{{"ServiceName", "alarm_session"}}));
    for (int type : {1, 1, 2})
      store->AddSessionMessage(id, 5, type, Value(Dictionary{{"a", type}}));
    store->AddSessionMessage(id, 0xFFFF, 0xFFFF, Value(Dictionary{{"a", "1,1,2"}}));
    store->MarkSessionFlushed(id, nullptr);
    store->AddSingleMessage(Value(Dictionary{}), Value(Dictionary{}), 5, 1,
                            Value(Dictionary{{"route", "speaker"}}));
    store->AddPowerLogEvent(28, "Vistrel_Haptics", Value(Dictionary{{"EngineOnDuration", 2}}));
    store->Drain();
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
      {{"session"}, "N"},
  };
  for (const auto& [args, problem] : cases) {
    EXPECT_EQ(Run(args), 2) << ::testing::PrintToString(args);
    EXPECT_NE(err_.str().find(problem), std::string::npos) << err_.str();
    EXPECT_NE(err_.str().find("--help"), std::string::npos) << err_.str();
  }
  EXPECT_EQ(Run({"events", "--help"}), 0);
  EXPECT_NE(out_.str().find("--follow"), std::string::npos);
}

TEST_F(CommandLineTest, DefaultsWriteReadsBackJsonOrPlainStringAndDeletes) {
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
}

TEST_F(CommandLineTest, NotifyPostTouchesTheNotificationFile) {
  const std::string file = paths().runtime_dir + "/notify/com.norvel.quenta.reporting";
  // Nobody has ever watched: nobody to tell, and nothing is created.
  EXPECT_EQ(Run({"notify", "post", "com.norvel.quenta.reporting"}), 0) << err_.str();
  EXPECT_FALSE(std::filesystem::exists(file));
  std::filesystem::create_directories(paths().runtime_dir + "/notify");
  EXPECT_EQ(Run({"notify", "post", "com.norvel.quenta.reporting"}), 0) << err_.str();
  EXPECT_TRUE(std::filesystem::exists(file));
  EXPECT_EQ(Run({"notify", "post", "../escape"}), 1);  // would leave the notification folder
}

TEST_F(CommandLineTest, EventsFiltersBySinkSessionAndTime) {
  EXPECT_EQ(Run({"events"}), 1);
  EXPECT_NE(err_.str().find("reports.db"), std::string::npos);
  FillStore();

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
}

TEST_F(CommandLineTest, SessionTellsStartStopCountsAndSummary) {
  FillStore();
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

TEST(TimeArgumentTest, ReadsRelativeAbsoluteAndEpochTimes) {
  const double now = 1'800'000'000;
  EXPECT_EQ(ParseTimeArgument("-90s", now), now - 90);
  EXPECT_EQ(ParseTimeArgument("-2h", now), now - 7200);
  EXPECT_EQ(ParseTimeArgument("1700000000.5", now), 1700000000.5);
  EXPECT_TRUE(ParseTimeArgument("2026-11-21 13:05", now));
  for (const char* bad : {"", "-", "-5y", "yesterdayish", "2026-13-45 99:99"}) {
    EXPECT_FALSE(ParseTimeArgument(bad, now)) << bad;
  }
}

}  // namespace
}  // namespace qn::qnreport
