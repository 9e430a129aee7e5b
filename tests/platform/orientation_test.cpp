#include <gtest/gtest.h>

#include "platform/linux/linux_orientation.h"
#include "platform/orientation_text.h"

namespace qn {
namespace {

// The one table every Orientation uses (the Linux one and the fake alike).
TEST(OrientationTextTest, Table) {
  const std::pair<int, const char*> table[] = {
      {0, "Unknown"},       {1, "Portrait"},       {2, "PortraitUpsideDown"},
      {3, "LandscapeLeft"}, {4, "LandscapeRight"}, {5, "FaceUp"},
      {6, "FaceDown"},      {7, "Unknown"},        {-1, "Unknown"}};
  for (const auto& [value, text] : table) EXPECT_EQ(OrientationText(value), text) << value;
  EXPECT_EQ(NewLinuxOrientation()->OrientationToString(3), "LandscapeLeft");
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
