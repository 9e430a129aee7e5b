// The device-information file: answers, the --internal-build override, a malformed file
// logged once (the fuzz target covers crash safety on any bytes).
#include <gtest/gtest.h>

#include <fstream>

#include "platform/linux/linux_device_info.h"
#include "tests/fakes/LogCapture.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

TEST(LinuxDeviceInfoTest, AnswersOverrideAndMalformedFiles) {
  testing::TempDir dir;
  auto log = std::make_shared<testing::LogCapture>();
  auto make = [&](const char* text, bool internal_build = false) {
    const std::string path = dir.path() + "/device-info.json";
    if (text) std::ofstream(path) << text;
    return NewLinuxDeviceInfo(
        {.path = text ? path : path + ".absent", .internal_build = internal_build, .log = log});
  };
  auto info = make(R"({"InternalBuild": true, "DeviceClassNumber": 6, "Model": "K5", "R": 2.9})");
  EXPECT_EQ(info->CopyAnswer("InternalBuild"), Value(true));
  EXPECT_EQ(info->GetSInt32Answer("DeviceClassNumber"), 6);
  EXPECT_EQ(info->CopyAnswer("Model"), Value("K5"));
  EXPECT_EQ(info->GetSInt32Answer("R"), 2);
  EXPECT_EQ(info->GetSInt32Answer("Model"), 0) << "a string is not a number";
  EXPECT_EQ(info->CopyAnswer("Missing"), std::nullopt);
  EXPECT_EQ(make(nullptr)->CopyAnswer("InternalBuild"), std::nullopt);
  EXPECT_TRUE(log->Lines().empty()) << "a missing file is not an error";

  EXPECT_EQ(make(nullptr, true)->CopyAnswer("InternalBuild"), Value(true));
  auto over = make(R"({"InternalBuild": false, "DeviceClassNumber": 3})", true);
  EXPECT_EQ(over->CopyAnswer("InternalBuild"), Value(true));
  EXPECT_EQ(over->GetSInt32Answer("DeviceClassNumber"), 3);

  for (const std::string text : {"{\"InternalBuild\": tru", "[1, 2]", ""}) {
    log->Clear();
    auto bad = make(text.c_str());
    EXPECT_EQ(bad->CopyAnswer("InternalBuild"), std::nullopt) << text;
    bad->CopyAnswer("DeviceClassNumber");
    ASSERT_EQ(log->Lines().size(), 1u) << text;
    EXPECT_EQ(log->Lines()[0].level, LogLevel::kError);
    EXPECT_NE(log->Lines()[0].text.find("device-info.json"), std::string::npos);
  }
}

}  // namespace
}  // namespace qn
