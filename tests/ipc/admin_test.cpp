// The administration commands of qnreport: defaults, notify and events, on a temporary home.
#include "tools/qnreport/Admin.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <sstream>

#include "common/Json.h"
#include "platform/linux/reporting_store.h"

namespace qn::qnreport {
namespace {

class AdminTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/qn-admin-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    home_ = pattern;
    paths_ = ResolvePaths(PathOptions{home_, std::nullopt});
  }
  void TearDown() override { std::filesystem::remove_all(home_); }

  int Run(int (*command)(const Paths&, const std::vector<std::string>&, std::ostream&,
                         std::ostream&),
          std::vector<std::string> args) {
    out_.str("");
    err_.str("");
    return command(paths_, args, out_, err_);
  }

  std::string home_;
  Paths paths_;
  std::ostringstream out_, err_;
};

TEST_F(AdminTest, DefaultsWriteReadsBackJsonOrPlainStringAndDeletes) {
  EXPECT_EQ(Run(RunDefaults, {"write", "disable_reporting", "YES"}), 0) << err_.str();
  EXPECT_EQ(Run(RunDefaults, {"write", "device_name", "\"lab phone\""}), 0);
  EXPECT_EQ(Run(RunDefaults, {"write", "level", "3"}), 0);
  ASSERT_EQ(Run(RunDefaults, {"read"}), 0);
  Value suite;
  ASSERT_FALSE(ParseJson(out_.str(), suite).has_value()) << out_.str();
  EXPECT_EQ(*suite.as_dictionary()->Find("disable_reporting"), Value("YES"));
  EXPECT_EQ(*suite.as_dictionary()->Find("device_name"), Value("lab phone"));
  EXPECT_EQ(*suite.as_dictionary()->Find("level"), Value(3));

  EXPECT_EQ(Run(RunDefaults, {"delete", "disable_reporting"}), 0);
  EXPECT_EQ(Run(RunDefaults, {"delete", "never_there"}), 0);
  ASSERT_EQ(Run(RunDefaults, {"read"}), 0);
  ASSERT_FALSE(ParseJson(out_.str(), suite).has_value());
  EXPECT_FALSE(suite.as_dictionary()->Contains("disable_reporting"));
}

TEST_F(AdminTest, UsageErrorsExitTwoAndSayWhatIsExpected) {
  for (const auto& args : std::vector<std::vector<std::string>>{
           {}, {"write", "only_key"}, {"delete"}, {"read", "extra"}, {"erase", "k"}}) {
    EXPECT_EQ(Run(RunDefaults, args), 2);
    EXPECT_NE(err_.str().find("write KEY VALUE"), std::string::npos);
  }
  EXPECT_EQ(Run(RunNotify, {"post"}), 2);
  EXPECT_EQ(Run(RunNotify, {"send", "x"}), 2);
  EXPECT_EQ(Run(RunEvents, {"--sink", "elsewhere"}), 2);
  EXPECT_EQ(Run(RunEvents, {"--colour"}), 2);
}

TEST_F(AdminTest, NotifyPostTouchesTheNotificationFile) {
  const std::string file = paths_.runtime_dir + "/notify/com.norvel.quenta.reporting";
  // Nobody has ever watched: nobody to tell, and nothing is created.
  EXPECT_EQ(Run(RunNotify, {"post", "com.norvel.quenta.reporting"}), 0) << err_.str();
  EXPECT_FALSE(std::filesystem::exists(file));
  // Once a watcher made the folder, posting touches the file the watcher sees close.
  std::filesystem::create_directories(paths_.runtime_dir + "/notify");
  EXPECT_EQ(Run(RunNotify, {"post", "com.norvel.quenta.reporting"}), 0) << err_.str();
  EXPECT_TRUE(std::filesystem::exists(file));
  // A name that would leave the notification folder is refused.
  EXPECT_EQ(Run(RunNotify, {"post", "../escape"}), 1);
}

TEST_F(AdminTest, EventsListsRowsOfOneSinkOrAllAndFailsWithoutAStore) {
  EXPECT_EQ(Run(RunEvents, {}), 1);
  EXPECT_NE(err_.str().find("reports.db"), std::string::npos);

  std::filesystem::create_directories(paths_.state_dir);
  {
    std::optional<Error> error;
    auto store = ReportingStore::Open(paths_.state_dir + "/reports.db", nullptr, &error);
    ASSERT_TRUE(store);
    store->AddSingleMessage(Value(Dictionary{}), Value(Dictionary{}), 5, 1,
                            Value(Dictionary{{"route", "speaker"}}));
    store->AddPowerLogEvent(28, "Vistrel_Haptics", Value(Dictionary{{"EngineOnDuration", 2}}));
    store->Drain();
  }
  ASSERT_EQ(Run(RunEvents, {}), 0) << err_.str();
  const std::string all = out_.str();
  EXPECT_NE(all.find("single  category 5 type 1  {\"route\":\"speaker\"}"), std::string::npos)
      << all;
  EXPECT_NE(all.find("powerlog 28 Vistrel_Haptics"), std::string::npos) << all;

  ASSERT_EQ(Run(RunEvents, {"--sink", "powerlog", "--json"}), 0);
  Value row;
  ASSERT_FALSE(ParseJson(out_.str(), row).has_value()) << out_.str();
  EXPECT_EQ(*row.as_dictionary()->Find("table"), Value("powerlog_events"));
  EXPECT_EQ(*row.as_dictionary()->Find("name"), Value("Vistrel_Haptics"));
  EXPECT_EQ(*row.as_dictionary()->Find("payload"), Value(Dictionary{{"EngineOnDuration", 2}}));
}

}  // namespace
}  // namespace qn::qnreport
