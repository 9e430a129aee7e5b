#include "Statistics/QNReportingUtility.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <optional>
#include <thread>
#include <vector>

#include "tests/fakes/FakePlatform.h"

namespace qn {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::MatchesRegex;
using namespace std::chrono_literals;

TEST(QNReportingUtilityTest, InternalBuildAskedOnceEvenWhenRacing) {
  FakePlatform t;
  t.device_info->SetAnswer("InternalBuild", true);
  std::vector<std::thread> threads;
  std::atomic<int> yes{0};
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] { yes += QNReportingIsInternalBuild(*t.platform); });
  }
  for (auto& th : threads) th.join();
  EXPECT_EQ(yes.load(), 8);
  // Later changes of the answer are not seen: the flag is kept.
  t.device_info->SetAnswer("InternalBuild", false);
  EXPECT_TRUE(QNReportingIsInternalBuild(*t.platform));
  EXPECT_EQ(t.device_info->Asked("InternalBuild"), 1);
}

class WaitTest : public ::testing::Test {
 protected:
  void StartWait(double timeout = 9.0) {
    QNReportingUtilityWait(*t_.platform, condition_, done_, "waiting for the thing",
                           "the thing never came", scope_, timeout,
                           [this](bool ok) { results_.push_back(ok); });
  }
  std::vector<std::string> Texts() const {
    std::vector<std::string> out;
    for (const auto& l : t_.log->Lines()) out.push_back(l.text);
    return out;
  }

  FakePlatform t_;
  std::shared_ptr<const LogScope> scope_ = t_.log->RegisterScope(
      true, 0x716E7272, "qnrr", "com.norvel.quenta", "reporting_session_verbose", 31);
  std::shared_ptr<Condition> condition_ = t_.dispatcher->CreateCondition();
  std::shared_ptr<bool> done_ = std::make_shared<bool>(false);
  std::vector<bool> results_;
};

TEST_F(WaitTest, TimesOutWithErrorLine) {
  StartWait();
  EXPECT_TRUE(results_.empty());
  t_.dispatcher->AdvanceBy(8999ms);
  EXPECT_TRUE(results_.empty());
  t_.dispatcher->AdvanceBy(1ms);
  EXPECT_THAT(results_, ElementsAre(false));
  auto lines = t_.log->Lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_THAT(lines[0].text, MatchesRegex("QNReportingUtility\\.cpp:[0-9]+:QNReportingUtilityWait: "
                                          "waiting for the thing"));
  EXPECT_EQ(lines[0].level, LogLevel::kDefault);
  EXPECT_EQ(lines[0].scope, "qnrr");
  EXPECT_THAT(lines[1].text, MatchesRegex("QNReportingUtility\\.cpp:[0-9]+:QNReportingUtilityWait: "
                                          "the thing never came"));
  EXPECT_EQ(lines[1].level, LogLevel::kError);
}

TEST_F(WaitTest, WakeWithoutFlagWaitsAFullNewPeriod) {
  StartWait();
  t_.dispatcher->AdvanceBy(5s);
  t_.dispatcher->WakeAllConditions();
  t_.dispatcher->RunUntilIdle();
  EXPECT_TRUE(results_.empty());
  EXPECT_EQ(t_.log->Count(": continuing"), 1);
  EXPECT_EQ(t_.log->Count(": waiting for the thing"), 2);
  // The first deadline (9 s after the start) has no effect any more.
  t_.dispatcher->AdvanceBy(8999ms);
  EXPECT_TRUE(results_.empty());
  t_.dispatcher->AdvanceBy(1ms);
  EXPECT_THAT(results_, ElementsAre(false));
  EXPECT_EQ(t_.log->Count("the thing never came"), 1);
}

}  // namespace
}  // namespace qn
