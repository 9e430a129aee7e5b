#include <gtest/gtest.h>

#include "platform/linux/linux_orientation.h"
#include "tests/fakes/FakeOrientation.h"

namespace qn {
namespace {

TEST(LinuxOrientationTest, TextsMatchTheFakesTable) {
  auto linux_orientation = NewLinuxOrientation();
  testing::FakeOrientation fake;
  const std::pair<int, const char*> table[] = {
      {0, "Unknown"},       {1, "Portrait"},       {2, "PortraitUpsideDown"},
      {3, "LandscapeLeft"}, {4, "LandscapeRight"}, {5, "FaceUp"},
      {6, "FaceDown"},      {7, "Unknown"},        {-1, "Unknown"}};
  for (const auto& [value, text] : table) {
    EXPECT_EQ(linux_orientation->OrientationToString(value), text) << value;
    EXPECT_EQ(fake.OrientationToString(value), text) << value;
  }
}

TEST(LinuxOrientationTest, RegistrationsAreKeptAndNeverCalled) {
  auto orientation = NewLinuxOrientation();
  auto calls = std::make_shared<int>(0);
  std::weak_ptr<int> watch = calls;
  orientation->RegisterDeviceOrientation("QNReportingService 1", [calls](int) { ++*calls; });
  orientation->RegisterUIOrientation("QNReportingService 1", [calls](int) { ++*calls; });
  orientation->RegisterDeviceOrientation("QNReportingService 1", [calls](int) { ++*calls; });
  calls.reset();
  EXPECT_FALSE(watch.expired()) << "registrations were dropped";
  orientation->UnregisterDeviceOrientation("QNReportingService 1");
  EXPECT_FALSE(watch.expired());
  orientation->UnregisterUIOrientation("QNReportingService 1");
  orientation->UnregisterUIOrientation("never registered");
  EXPECT_TRUE(watch.expired()) << "unregistered callbacks were kept";
}

}  // namespace
}  // namespace qn
