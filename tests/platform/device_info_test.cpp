#include <gtest/gtest.h>

#include <fstream>
#include <vector>

#include "platform/linux/linux_device_info.h"
#include "tests/fakes/LogCapture.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

class LinuxDeviceInfoTest : public ::testing::Test {
 protected:
  std::string WriteFile(const std::string& text) {
    const std::string path = dir_.path() + "/device-info.json";
    std::ofstream(path) << text;
    return path;
  }
  std::shared_ptr<DeviceInfo> Make(const std::string& path, bool internal_build = false) {
    return NewLinuxDeviceInfo({.path = path, .internal_build = internal_build, .log = log_});
  }

  testing::TempDir dir_;
  std::shared_ptr<testing::LogCapture> log_ = std::make_shared<testing::LogCapture>();
};

TEST_F(LinuxDeviceInfoTest, AnswersFromTheFile) {
  auto info = Make(
      WriteFile(R"({"InternalBuild": true, "DeviceClassNumber": 6, "Model": "K5", "Ratio": 2.9})"));
  EXPECT_EQ(info->CopyAnswer("InternalBuild"), Value(true));
  EXPECT_EQ(info->GetSInt32Answer("DeviceClassNumber"), 6);
  EXPECT_EQ(info->CopyAnswer("Model"), Value("K5"));
  EXPECT_EQ(info->GetSInt32Answer("Ratio"), 2);
  EXPECT_EQ(info->GetSInt32Answer("Model"), 0) << "a string is not a number";
  EXPECT_EQ(info->CopyAnswer("Missing"), std::nullopt);
  EXPECT_TRUE(log_->Lines().empty());
}

TEST_F(LinuxDeviceInfoTest, MissingFileIsQuietlyEmpty) {
  auto info = Make(dir_.path() + "/absent.json");
  EXPECT_EQ(info->CopyAnswer("InternalBuild"), std::nullopt);
  EXPECT_EQ(info->GetSInt32Answer("DeviceClassNumber"), 0);
  EXPECT_TRUE(log_->Lines().empty());
}

TEST_F(LinuxDeviceInfoTest, OverrideMakesTheBuildInternal) {
  auto without_file = Make(dir_.path() + "/absent.json", /*internal_build=*/true);
  EXPECT_EQ(without_file->CopyAnswer("InternalBuild"), Value(true));
  auto over_file = Make(WriteFile(R"({"InternalBuild": false, "DeviceClassNumber": 3})"),
                        /*internal_build=*/true);
  EXPECT_EQ(over_file->CopyAnswer("InternalBuild"), Value(true));
  EXPECT_EQ(over_file->GetSInt32Answer("DeviceClassNumber"), 3);
}

TEST_F(LinuxDeviceInfoTest, MalformedFileIsLoggedOnceAndIgnored) {
  const std::vector<std::string> texts = {"{\"InternalBuild\": tru", "[1, 2]", "",
                                          std::string(100, '[')};
  for (const std::string& text : texts) {
    log_->Clear();
    auto info = Make(WriteFile(text));
    EXPECT_EQ(info->CopyAnswer("InternalBuild"), std::nullopt) << text;
    info->CopyAnswer("DeviceClassNumber");
    ASSERT_EQ(log_->Lines().size(), 1u) << text;
    EXPECT_EQ(log_->Lines()[0].level, LogLevel::kError);
    EXPECT_NE(log_->Lines()[0].text.find("device-info.json"), std::string::npos);
  }
}

}  // namespace
}  // namespace qn
