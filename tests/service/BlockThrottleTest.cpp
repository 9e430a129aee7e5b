// The block throttle: message keys and throttle times (pure), and the debounce on its own
// thread (real time, with wide margins; checks are of order and count).
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <stdexcept>

#include "Statistics/Service/QNReportingBlockThrottle.h"
#include "tests/fakes/LogCapture.h"

namespace qn {
namespace {

using ::testing::EndsWith;
using Throttle = QNReportingBlockThrottle;
using testing::LogCapture;

std::string Key(const Dictionary& payload, std::int64_t id = 1, std::uint32_t category = 5,
                std::uint16_t type = 1) {
  return Throttle::buildMessageKey(payload, id, category, type);
}

TEST(MessageKeyTest, PartsInKeyOrderWithMaskedValues) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {Throttle::buildMessageKey(Dictionary{{"b", 2}, {"a", "x"}, {"systemuptime_sec", 812}}, 42, 5,
                                 1),
       "a|x|b|2|systemuptime_sec|^|reporterID|42|Setup|Start"},
      {Throttle::buildMessageKey(Dictionary{}, 7, 1, 0), "reporterID|7|Generic|Generic"},
      // Code-point order: upper case, then "_", then lower case.
      {Key(Dictionary{{"b", 1}, {"_x", 2}, {"A", 3}}), "A|3|_x|2|b|1|reporterID|1|Setup|Start"},
      {Key(Dictionary{{"a", 1}, {"_comparison_field_blacklist", Array{Value("a")}}}),
       "_comparison_field_blacklist|^|a|^|reporterID|1|Setup|Start"},
      // A skip list that is not an array is ignored.
      {Key(Dictionary{{"a", 1}, {"_comparison_field_blacklist", "a"}}),
       "_comparison_field_blacklist|^|a|1|reporterID|1|Setup|Start"},
      {Key(Dictionary{{"Volume", 0.5}, {"VolumeOperationTime", 3}, {"_throttle_seconds", 1}}),
       "Volume|^|VolumeOperationTime|^|_throttle_seconds|^|reporterID|1|Setup|Start"},
  };
  for (const auto& [key, expected] : cases) EXPECT_EQ(key, expected);
}

TEST(MessageKeyTest, DuplicatesAndDistinctMessages) {
  struct Case {
    std::string a, b;
    bool duplicates;
  };
  const Case cases[] = {
      {Key(Dictionary{{"x", 1}, {"qnreporting_timestamp", 1}}),
       Key(Dictionary{{"x", 1}, {"qnreporting_timestamp", 2}}), true},
      {Key(Dictionary{{"Volume", 0.3}, {"VolumeOperationTime", 1}}),
       Key(Dictionary{{"Volume", 0.7}, {"VolumeOperationTime", 2}}), true},
      {Key(Dictionary{{"Volume", 0.3}}), Key(Dictionary{{"Volume", 0.7}}), false},
      {Key(Dictionary{{"x", 1}, {"processuptime_ms", 5}}), Key(Dictionary{{"x", 1}}), false},
      {Key(Dictionary{}, 1, 12), Key(Dictionary{}, 1, 13), true},  // both "Undefined"
      {Key(Dictionary{}, 1, 5, 6), Key(Dictionary{}, 1, 5, 65534), true},
      {Key(Dictionary{}, 1), Key(Dictionary{}, 2), false},
  };
  for (const Case& c : cases) EXPECT_EQ(c.a == c.b, c.duplicates) << c.a << " / " << c.b;
}

TEST(ThrottleTimeTest, AcceptsIntegerPartUpToFourElseHalfASecondWithAnInfoLine) {
  struct Case {
    std::optional<Value> time;
    double seconds;
    std::string line;  // the info line's text after the prefix, or "" for none
  };
  const Case cases[] = {
      {std::nullopt, 0.5, ""},
      {Value(4.99), static_cast<double>(4.99f), ""},
      {Value(-1), -1.0, ""},
      {Value(0), 0.0, ""},
      {Value(5), 0.5, ": Rejecting large throttle time. {time=5, max=5.000000}"},
      {Value("2"), 0.5, ": Rejecting non Valbox value of throttle time. {time=2}"},
  };
  for (const Case& c : cases) {
    LogCapture log;
    Dictionary payload;
    if (c.time) payload.Set("_throttle_seconds", *c.time);
    EXPECT_EQ(Throttle::determineSleepTime(payload, log), c.seconds);
    const auto lines = log.Lines();
    ASSERT_EQ(lines.size(), c.line.empty() ? 0u : 1u);
    if (!c.line.empty()) {
      EXPECT_EQ(lines[0].level, LogLevel::kInfo);
      EXPECT_THAT(lines[0].text, EndsWith(c.line));
    }
  }
}

class BlockThrottleTest : public ::testing::Test {
 protected:
  void SetUp() override { log_->EnableDebug("all"); }
  std::shared_ptr<LogCapture> log_ = std::make_shared<LogCapture>();
  Throttle throttle_{log_, nullptr};
};

// Two same-key messages 0.2 s apart with a delay well above that (wide margin).
TEST_F(BlockThrottleTest, OnlyTheLastActionOfABurstRunsOnce) {
  std::atomic<int> first{0}, second{0}, other{0};
  std::promise<void> ran;
  const Dictionary message{{"a", 1}, {"_throttle_seconds", 1.5}};
  throttle_.addMessageBlock([&] { ++first; }, 1, message, 5, 1);
  std::this_thread::sleep_for(std::chrono::milliseconds(200));
  const auto second_added = std::chrono::steady_clock::now();
  std::chrono::steady_clock::time_point second_ran;
  throttle_.addMessageBlock(
      [&] {
        second_ran = std::chrono::steady_clock::now();
        ++second, ran.set_value();
      },
      1, message, 5, 1);
  throttle_.addMessageBlock([&] { ++other; }, 2, message, 5, 1);  // another reporter
  ASSERT_EQ(ran.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  throttle_.waitForCompletion();
  EXPECT_EQ(first, 0);
  EXPECT_EQ(second, 1);
  EXPECT_GE(second_ran - second_added, std::chrono::milliseconds(1450));  // the delay restarted
  EXPECT_EQ(other, 1);
  EXPECT_EQ(
      log_->Count(
          ": Dropping duplicate message for _throttle_seconds|^|a|1|reporterID|1|Setup|Start"),
      1);
  EXPECT_EQ(throttle_.timersInFlightCount(), 0u);
  // The queue thread's own debug lines.
  for (const char* text :
       {": calling workingRunLoop run from inside thread block", ": sleeping in thread"}) {
    const auto lines = log_->Lines();
    EXPECT_TRUE(std::any_of(lines.begin(), lines.end(), [text](const auto& line) {
      return line.level == LogLevel::kDebug && line.text.ends_with(text);
    })) << text;
  }
}

TEST_F(BlockThrottleTest, AnActionThatThrowsLeavesNoEntryAndTheThrottleGoesOn) {
  std::promise<void> ran;
  throttle_.addMessageBlock([] { throw std::runtime_error("boom"); }, 1,
                            Dictionary{{"_throttle_seconds", 0}}, 5, 1);
  // The throttle goes on after the failure: another action still runs.
  throttle_.addMessageBlock([&] { ran.set_value(); }, 2, Dictionary{{"_throttle_seconds", 0}}, 5,
                            1);
  ASSERT_EQ(ran.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  throttle_.waitForCompletion();
  EXPECT_EQ(throttle_.timersInFlightCount(), 0u);
  // The failure is logged once the exception has left the action (bounded wait).
  for (int i = 0; i < 100 && log_->Count(": throttled action failed: boom") == 0; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
  EXPECT_EQ(log_->Count(": throttled action failed: boom"), 1);
}

TEST_F(BlockThrottleTest, WaitForCompletionReturnsAtOnceOrGivesUpAfterFiveSeconds) {
  throttle_.waitForCompletion();
  auto lines = log_->Lines();  // no wait, no give-up line; the thread's own lines aside
  std::erase_if(lines,
                [](const auto& line) { return line.text.ends_with(": sleeping in thread"); });
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::kInfo);
  EXPECT_THAT(lines[0].text,
              EndsWith(": waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0"));

  // An action that outlasts the wait keeps its entry until it returns.
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  throttle_.addMessageBlock([released] { released.wait(); }, 1,
                            Dictionary{{"_throttle_seconds", 0}}, 5, 1);
  throttle_.waitForCompletion();
  release.set_value();
  EXPECT_EQ(log_->Count("Waiting up to 5 seconds for blockThrottle queue to be empty."), 1);
  const auto gave_up = log_->Matching("Giving up");
  ASSERT_EQ(gave_up.size(), 1u);
  EXPECT_THAT(gave_up[0],
              EndsWith(": Giving up on waiting for completion after 5 seconds. timersInFlight=1"));
}

}  // namespace
}  // namespace qn
