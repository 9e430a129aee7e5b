// Sessions on the real Linux dispatcher: a start that waits for backends holds its own
// queue, not a pool thread, so other sessions' deliveries go on.
#include <gtest/gtest.h>

#include <chrono>

#include "Statistics/Service/QNReportingSession.h"
#include "platform/linux/linux_dispatch.h"
#include "tests/fakes/FakeLivoReporting.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TraceRecorder.h"

namespace qn {
namespace {

using testing::FakeLivoReporting;
using namespace std::chrono_literals;

TEST(SessionLinuxDispatchTest, WaitingStartsDoNotHoldUpOtherSessions) {
  constexpr int kWaiting = 200;
  constexpr int kMessages = 10;
  auto log = std::make_shared<testing::LogCapture>();
  log->EnableDebug("qnrr");
  // Waits for the lines that mark each step; the limit only guards against a hang.
  auto wait_for = [&](std::string_view needle, int count) {
    return log->WaitForCount(needle, count, 120s);
  };
  auto trace = std::make_shared<testing::TraceRecorder>();
  std::shared_ptr<Dispatcher> dispatcher = NewLinuxDispatcher({.threads = 2});

  auto makePlatform = [&](std::shared_ptr<FakeLivoReporting> livo) {
    auto p = std::make_shared<Platform>();
    p->log = log;
    p->trace = trace;
    p->dispatcher = dispatcher;
    p->livo_reporting = std::move(livo);
    return p;
  };
  auto silentLivo = std::make_shared<FakeLivoReporting>();
  silentLivo->SetDiscovery(FakeLivoReporting::Discovery::kNever);
  auto answeringLivo = std::make_shared<FakeLivoReporting>();
  auto silentPlatform = makePlatform(silentLivo);
  auto answeringPlatform = makePlatform(answeringLivo);

  std::vector<std::shared_ptr<QNReportingSession>> waiting;
  for (int i = 0; i < kWaiting; ++i) {
    auto s = QNReportingSession::initWithID(silentPlatform, 1000 + i, Array{});
    s->start();
    s->sendMessage(std::make_shared<const Dictionary>(Dictionary{{"i", i}}), 1, 0, nullptr);
    waiting.push_back(std::move(s));
  }
  ASSERT_TRUE(wait_for("waiting for livoreportingd to find backends", kWaiting));

  // Every start above is now holding its queue. A session whose backends answer at once
  // delivers all of its messages all the same.
  auto other = QNReportingSession::initWithID(answeringPlatform, 1, Array{});
  other->start();
  for (int i = 0; i < kMessages; ++i) {
    other->sendMessage(std::make_shared<const Dictionary>(Dictionary{{"n", i}}), 1, 0, nullptr);
  }
  ASSERT_TRUE(wait_for("LivoReportingAgent", kMessages));
  EXPECT_EQ(answeringLivo->AllSessionMessages().size(), static_cast<std::size_t>(kMessages));

  // ... while none of the waiting sessions has timed out or delivered anything.
  EXPECT_EQ(log->Count("failed to find backend"), 0);
  EXPECT_EQ(log->Count("No valid LivoReportingSession"), 0);
  EXPECT_TRUE(silentLivo->AllSessionMessages().empty());

  // When the backends turn up, every held queue resumes and delivers its message.
  EXPECT_EQ(silentLivo->AnswerPending(Array{Value("late")}), kWaiting);
  ASSERT_TRUE(wait_for("LivoReportingAgent", kMessages + kWaiting));
  EXPECT_EQ(silentLivo->AllSessionMessages().size(), static_cast<std::size_t>(kWaiting));
  EXPECT_EQ(log->Count(": continuing"), kWaiting);

  // Stop everything (each stop sends one summary event) and let the queued work release
  // the sessions before the dispatcher goes.
  for (auto& s : waiting) s->stop();
  other->stop();
  ASSERT_TRUE(wait_for("LivoReportingAgent", kMessages + 2 * kWaiting + 1));
  waiting.clear();
  other.reset();
  ASSERT_TRUE(wait_for("deallocing this session", kWaiting + 1));
}

}  // namespace
}  // namespace qn
