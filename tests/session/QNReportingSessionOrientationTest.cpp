// Orientation reporting of telephony and long-form audio sessions on internal builds.
#include <atomic>
#include <chrono>
#include <thread>

#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using testing::Payload;
using namespace std::chrono_literals;
using OrientationTest = testing::SessionFixture;

TEST_F(OrientationTest, ChangesFiledInSecondsUnregisteredAtStop) {
  SetInternal(true);
  t_.log->EnableDebug("qnrr");
  auto session = NewSession(42, 2);
  session->setConfiguration(Payload({{"HostApplicationDisplayID", "org.example.phone"}}));
  session->start();
  EXPECT_EQ(session->orientationCallbackID(), "QNReportingService 42");
  ASSERT_TRUE(session->startDate());
  const auto wallStart = t_.dispatcher->WallNow();
  EXPECT_DOUBLE_EQ(session->startDate()->seconds_since_1970,
                   std::chrono::duration<double>(wallStart.time_since_epoch()).count());
  EXPECT_THAT(t_.orientation->Events(), ElementsAre("register device QNReportingService 42",
                                                    "register ui QNReportingService 42"));

  t_.dispatcher->AdvanceBy(1234500us);
  EXPECT_EQ(t_.orientation->FireDevice(3), 1);
  t_.dispatcher->AdvanceBy(765500us);  // 2.000 s after start
  EXPECT_EQ(t_.orientation->FireUI(1), 1);
  t_.dispatcher->AdvanceBy(1999us);
  t_.orientation->FireDevice(4);

  EXPECT_THAT(
      session->aggregatedPayloadData()->Snapshot(),
      ElementsAre(Value(Dictionary{{"device_orientation", "LandscapeLeft"},
                                   {"device_orientation_time", 1.234}}),
                  Value(Dictionary{{"ui_orientation", "Portrait"}, {"ui_orientation_time", 2.0}}),
                  Value(Dictionary{{"device_orientation", "LandscapeRight"},
                                   {"device_orientation_time", 2.001}})));
  EXPECT_THAT(
      t_.log->Matching("Orientation handler"),
      ElementsAre(::testing::MatchesRegex(
                      "QNReportingSession\\.cpp:[0-9]+:.*: Orientation handler callback "
                      "mode=device orientation=\"LandscapeLeft\" app=\"org.example.phone\", "
                      "time=1.234, id=\"QNReportingService 42\""),
                  ::testing::EndsWith(": Orientation handler callback mode=ui "
                                      "orientation=\"Portrait\" app=\"org.example.phone\", "
                                      "time=2, id=\"QNReportingService 42\""),
                  ::testing::HasSubstr("time=2.001,")));

  // The entries reach the summary under their four keys, in the order of the changes.
  auto summary = session->createSummaryEventForSession();
  ASSERT_TRUE(summary);
  EXPECT_EQ(*summary->Find("device_orientation"), Value("LandscapeLeft,LandscapeRight"));
  EXPECT_EQ(*summary->Find("device_orientation_time"), Value("1.234,2.001"));
  EXPECT_EQ(*summary->Find("ui_orientation"), Value("Portrait"));
  EXPECT_EQ(*summary->Find("ui_orientation_time"), Value("2"));

  session->stop();
  EXPECT_FALSE(session->orientationCallbackID());
  EXPECT_THAT(t_.orientation->Events(), ElementsAre("register device QNReportingService 42",
                                                    "register ui QNReportingService 42",
                                                    "unregister device QNReportingService 42",
                                                    "unregister ui QNReportingService 42"));
  EXPECT_EQ(t_.orientation->DeviceRegistrations() + t_.orientation->UIRegistrations(), 0);
  t_.dispatcher->RunUntilIdle();
}

TEST_F(OrientationTest, CallbacksRaceWithIntakeAndStop) {
  SetInternal(true);
  auto session = NewSession(42, 7);
  session->start();
  std::atomic<bool> go{true};
  std::thread source([&] {
    for (int i = 0; go.load(); ++i) {
      t_.orientation->FireDevice(i % 6 + 1);
      t_.orientation->FireUI(i % 6 + 1);
    }
  });
  for (int i = 0; i < 200; ++i) {
    session->sendMessage(Payload({{"i", i}}), 1, 0, nullptr);
  }
  auto aggregated = session->aggregatedPayloadData();
  session->stop();
  go = false;
  source.join();
  // Every message and at least the changes before stop were filed; after stop the session
  // has no array for late callbacks to add to.
  EXPECT_GE(aggregated->Snapshot().size(), 200u);
  EXPECT_FALSE(session->aggregatedPayloadData());
  t_.dispatcher->RunUntilIdle();
}

}  // namespace
}  // namespace qn
