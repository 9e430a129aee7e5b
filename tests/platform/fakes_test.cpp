// The switches and records of the platform fakes that the contract tests do not cover.

#include <gtest/gtest.h>

#include <cerrno>

#include "tests/fakes/FakeNotify.h"
#include "tests/fakes/FakeOstrel.h"
#include "tests/fakes/FakeProcess.h"

namespace qn {
namespace {

TEST(FakeProcessTest, NamesFromTheTable) {
  testing::FakeProcess process(100, "qnreportingd");
  process.SetName(200, "mediaserverd");
  EXPECT_EQ(process.Pid(), 100);
  EXPECT_EQ(process.NameOf(100), "qnreportingd");
  EXPECT_EQ(process.NameOf(200), "mediaserverd");
  EXPECT_EQ(process.NameOf(300), std::nullopt);
  EXPECT_EQ(process.NameOf(0), std::nullopt);
  process.SetName(0, "swapper");
  EXPECT_EQ(process.NameOf(0), std::nullopt) << "pids below 1 never have a name";
  process.RemoveName(200);
  EXPECT_EQ(process.NameOf(200), std::nullopt);
}

TEST(FakeProcessTest, ExitRunsTheHookThenThrows) {
  testing::FakeProcess process;
  int hooked = -1;
  process.SetExitHook([&](int status) { hooked = status; });
  EXPECT_EQ(process.exit_status(), std::nullopt);
  try {
    process.Exit(2);
    ADD_FAILURE() << "Exit returned";
  } catch (const testing::ProcessExited& exited) {
    EXPECT_EQ(exited.status, 2);
  }
  EXPECT_EQ(hooked, 2);
  EXPECT_EQ(process.exit_status(), 2);
  EXPECT_EQ(process.exit_calls(), 1);
}

TEST(FakeNotifyTest, FailedRegistrationsRegisterNothing) {
  testing::FakeNotify notify;
  notify.FailRegistrations(1000000);
  int token = 0;
  // The queue is never used: nothing registers.
  EXPECT_EQ(notify.Register(
                "n", nullptr, [](int) {}, &token),
            2u);
  EXPECT_EQ(notify.Posts("n"), 0);
  EXPECT_EQ(notify.Registrations("n"), 0);
  EXPECT_EQ(notify.Post("n"), 0u);
  EXPECT_EQ(notify.Posts("n"), 1);
}

TEST(FakeOstrelTest, SwitchesMakeOperationsFail) {
  testing::FakeOstrel ostrel;
  ostrel.SetCounter("Speaker", "Amp", "Clips", 5);
  ostrel.SetCounter("Haptics", "Stats", "Drops", 1);

  std::optional<OstrelError> error;
  ostrel.FailLookup("Speaker", std::nullopt, -536870160, /*still_return_channels=*/true);
  auto speaker = ostrel.CopyChannelsInGroup("Speaker", std::nullopt, 0, &error);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, -536870160);
  ASSERT_TRUE(speaker) << "asked to return the channels despite the error";
  ostrel.FailLookup("Haptics", "Stats", 7);
  error.reset();
  EXPECT_EQ(ostrel.CopyChannelsInGroup("Haptics", "Stats", 0, &error), std::nullopt);
  EXPECT_EQ(error->code, 7);
  ostrel.ClearFailures();

  Dictionary speaker_channels;
  auto speaker_sub = ostrel.CreateSubscription(*speaker, &speaker_channels);
  auto haptics = ostrel.CopyChannelsInGroup("Haptics", "Stats", 0, &error);
  Dictionary haptics_channels;
  auto haptics_sub = ostrel.CreateSubscription(*haptics, &haptics_channels);

  ostrel.FailSamplingOf("Haptics", "Stats", 9);
  error.reset();
  EXPECT_TRUE(ostrel.CreateSamples(speaker_sub.get(), speaker_channels, &error));
  EXPECT_FALSE(error);
  EXPECT_EQ(ostrel.CreateSamples(haptics_sub.get(), haptics_channels, &error), std::nullopt);
  EXPECT_EQ(error->code, 9);

  ostrel.ClearFailures();
  ostrel.FailSampling(11);
  error.reset();
  EXPECT_EQ(ostrel.CreateSamples(speaker_sub.get(), speaker_channels, &error), std::nullopt);
  EXPECT_EQ(error->code, 11);

  ostrel.ClearFailures();
  auto samples = ostrel.CreateSamples(speaker_sub.get(), speaker_channels, &error);
  ASSERT_TRUE(samples);
  ostrel.FailDeltas(13);
  error.reset();
  EXPECT_EQ(ostrel.CreateSamplesDelta(&*samples, *samples, &error), std::nullopt);
  EXPECT_EQ(error->code, 13);
  EXPECT_EQ(ostrel.samplings(), 4);
  EXPECT_EQ(ostrel.deltas(), 1);
}

TEST(FakeOstrelTest, UnnamedChannelsHaveNoName) {
  testing::FakeOstrel ostrel;
  ostrel.SetCounter("Haptics", "Stats", "c0", 3, /*named=*/false);
  std::optional<OstrelError> error;
  auto channels = ostrel.CopyChannelsInGroup("Haptics", "Stats", 0, &error);
  Dictionary subscribed;
  auto sub = ostrel.CreateSubscription(*channels, &subscribed);
  auto samples = ostrel.CreateSamples(sub.get(), subscribed, &error);
  ASSERT_TRUE(samples);
  ostrel.Iterate(*samples, [&](const Value& sample) {
    EXPECT_EQ(ostrel.ChannelGetChannelName(sample), std::nullopt);
    EXPECT_EQ(ostrel.SimpleGetIntegerValue(sample, 0), 3);
    return 0;
  });
}

}  // namespace
}  // namespace qn
