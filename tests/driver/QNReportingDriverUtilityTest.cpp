#include "Statistics/QNReportingDriverUtility.h"

#include <gtest/gtest.h>

#include <cerrno>

#include "tests/fakes/FakePlatform.h"

namespace qn {
namespace {

class DriverUtilityTest : public ::testing::Test {
 protected:
  QNReportingDriverUtility Make() { return QNReportingDriverUtility(t_.platform); }
  static std::int64_t At(const Dictionary& d, const char* key) {
    const Value* v = d.Find(key);
    return v ? v->as_int64().value_or(-999) : -999;
  }

  testing::FakePlatform t_;
  testing::LogCapture* log_ = t_.log.get();
  testing::FakeOstrel* ostrel_ = t_.ostrel.get();
};

TEST_F(DriverUtilityTest, NoDriversSubscribesAndReportsNothing) {
  // Speaker exists but has no channels; the other three groups are unknown to the library.
  ostrel_->AddGroup("Speaker", "Amp");
  auto utility = Make();

  EXPECT_TRUE(utility.ioChannelSubscriptions().empty());
  EXPECT_EQ(log_->Count("creating ostreling driver utility"), 1);
  EXPECT_EQ(log_->Count("couldn't find any channels for driver group Speaker-(null)"), 1);
  // Only the lookup that returned a (here empty) description gets the "subscribed" line.
  EXPECT_EQ(log_->Count("subscribed to group group "), 1);
  EXPECT_EQ(log_->Count("subscribed to group group Speaker-(null)"), 1);
  EXPECT_TRUE(utility.getSnapShot().empty());
  EXPECT_FALSE(utility.getDriverStatisticsRelativeToSnapShot(nullptr).has_value());
  // Every line carries the prefix and goes to the driver scope.
  for (const auto& line : log_->Lines()) {
    EXPECT_EQ(line.text.rfind("QNReportingDriverUtility.cpp:", 0), 0u) << line.text;
    EXPECT_EQ(line.scope, "qnrd");
  }
}

TEST_F(DriverUtilityTest, LookupErrorIsLoggedChannelsStillSubscribed) {
  ostrel_->SetCounter("Haptics", "Stats", "on_time", 3);
  ostrel_->FailLookup(std::string("Haptics"), std::string("Stats"), 42, true);
  auto utility = Make();

  EXPECT_EQ(log_->Count("error 42 getting channels for driver Haptics-Stats"), 1);
  ASSERT_EQ(utility.ioChannelSubscriptions().size(), 1u);
  EXPECT_EQ(utility.ioChannelSubscriptions()[0]->driver()->Description(), "Haptics-Stats");
  EXPECT_EQ(log_->Count("subscribed to group group Haptics-Stats"), 1);
}

TEST_F(DriverUtilityTest, DeltaReportsOnlyCountersThatGrew) {
  ostrel_->SetCounter("Speaker", "Amp", "underruns", 5);
  ostrel_->SetCounter("Speaker", "Amp", "overruns", 7);
  ostrel_->SetCounter("Speaker", "Amp", "resets", 4);
  ostrel_->SetCounter("Haptics", "Stats", "unnamed", 1, /*named=*/false);
  auto utility = Make();
  ASSERT_EQ(utility.ioChannelSubscriptions().size(), 2u);

  Dictionary snapshot = utility.getSnapShot();
  EXPECT_TRUE(snapshot.Contains("Speaker-(null)"));
  EXPECT_TRUE(snapshot.Contains("Haptics-Stats"));
  EXPECT_EQ(log_->Count("sampling driver Speaker-(null)"), 1);

  ostrel_->SetCounter("Speaker", "Amp", "underruns", 9);         // grew by 4
  ostrel_->SetCounter("Speaker", "Amp", "resets", 2);            // went down: left out
  ostrel_->SetCounter("Haptics", "Stats", "unnamed", 3, false);  // grew by 2, no name
  auto delta = utility.getDriverStatisticsRelativeToSnapShot(&snapshot);
  ASSERT_TRUE(delta.has_value());
  EXPECT_EQ(delta->size(), 2u);  // overruns did not move
  EXPECT_EQ(At(*delta, "Speaker_underruns"), 4);
  EXPECT_EQ(At(*delta, "Haptics_Stats_"), 2);
  EXPECT_EQ(log_->Count("getting latest samples"), 4);  // two lines per driver
}

TEST_F(DriverUtilityTest, NoSnapshotOfTheDriverGivesAbsoluteValues) {
  ostrel_->SetCounter("Speaker", "Amp", "underruns", 5);
  ostrel_->SetCounter("Speaker", "Amp", "idle", 0);
  auto utility = Make();

  auto absolute = utility.getDriverStatisticsRelativeToSnapShot(nullptr);
  ASSERT_TRUE(absolute.has_value());
  EXPECT_EQ(absolute->size(), 1u);
  EXPECT_EQ(At(*absolute, "Speaker_underruns"), 5);
  EXPECT_EQ(log_->Count("OstrelCreateSamplesDelta error"), 0);

  // A snapshot that lacks the driver: the library cannot difference it, so the counters
  // are reported by their absolute values after an error line.
  Dictionary empty_snapshot;
  auto fallback = utility.getDriverStatisticsRelativeToSnapShot(&empty_snapshot);
  ASSERT_TRUE(fallback.has_value());
  EXPECT_EQ(At(*fallback, "Speaker_underruns"), 5);
  EXPECT_EQ(log_->Count(StringWithFormat("OstrelCreateSamplesDelta error %i", ENODATA)), 1);
}

TEST_F(DriverUtilityTest, SamplingFailureLeavesTheDriverOut) {
  ostrel_->SetCounter("Speaker", "Amp", "underruns", 5);
  ostrel_->SetCounter("Haptics", "Stats", "on_time", 6);
  auto utility = Make();
  Dictionary snapshot = utility.getSnapShot();

  ostrel_->FailSamplingOf("Speaker", "Amp", 5);
  EXPECT_FALSE(utility.getSnapShot().Contains("Speaker-(null)"));
  EXPECT_EQ(log_->Count("OstrelCreateSamples error 5"), 1);

  ostrel_->SetCounter("Haptics", "Stats", "on_time", 10);
  auto delta = utility.getDriverStatisticsRelativeToSnapShot(&snapshot);
  ASSERT_TRUE(delta.has_value());
  EXPECT_EQ(delta->size(), 1u);
  EXPECT_EQ(At(*delta, "Haptics_Stats_on_time"), 4);
  EXPECT_EQ(log_->Count("OstrelCreateSamples error 5"), 2);
}

}  // namespace
}  // namespace qn
