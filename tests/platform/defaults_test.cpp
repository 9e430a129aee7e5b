#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "common/Json.h"
#include "platform/linux/linux_defaults.h"
#include "tests/fakes/FakeDefaults.h"
#include "tests/fakes/LogCapture.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

constexpr const char* kSuite = "com.norvel.quenta";

struct LinuxDefaultsHarness {
  testing::TempDir dir;
  std::shared_ptr<testing::LogCapture> log = std::make_shared<testing::LogCapture>();
  std::shared_ptr<Defaults> defaults = NewLinuxDefaults({.state_dir = dir.path(), .log = log});

  void Set(const std::string& suite, const std::string& key, Value value) {
    ASSERT_EQ(WriteDefault(dir.path(), suite, key, value), std::nullopt);
  }
  void Remove(const std::string& suite, const std::string& key) {
    ASSERT_EQ(DeleteDefault(dir.path(), suite, key), std::nullopt);
  }
};

struct FakeDefaultsHarness {
  std::shared_ptr<testing::FakeDefaults> fake = std::make_shared<testing::FakeDefaults>();
  std::shared_ptr<Defaults> defaults = fake;

  void Set(const std::string& suite, const std::string& key, Value value) {
    fake->Set(suite, key, std::move(value));
  }
  void Remove(const std::string& suite, const std::string& key) { fake->Remove(suite, key); }
};

template <typename Harness>
class DefaultsContractTest : public ::testing::Test {
 protected:
  Harness h_;
};

using Harnesses = ::testing::Types<LinuxDefaultsHarness, FakeDefaultsHarness>;
TYPED_TEST_SUITE(DefaultsContractTest, Harnesses);

TYPED_TEST(DefaultsContractTest, BoolReadings) {
  const std::vector<std::pair<Value, bool>> cases = {
      {"YES", true},     {"yes", true},
      {"true", true},    {"TRUE", true},
      {"1", true},       {"2 cats", true},
      {" -3", true},     {"0", false},
      {"00", false},     {"no", false},
      {"false", false},  {"", false},
      {"Y", false},      {0, false},
      {2, true},         {-1, true},
      {0.0, false},      {0.25, true},
      {true, true},      {false, false},
      {Array{1}, false}, {Dictionary{{"a", 1}}, false},
      {nullptr, false},
  };
  for (std::size_t i = 0; i < cases.size(); ++i) {
    this->h_.Set(kSuite, "key" + std::to_string(i), cases[i].first);
  }
  auto suite = this->h_.defaults->OpenSuite(kSuite);
  for (std::size_t i = 0; i < cases.size(); ++i) {
    EXPECT_EQ(suite->BoolForKey("key" + std::to_string(i)), cases[i].second)
        << cases[i].first.Description();
  }
  EXPECT_FALSE(suite->BoolForKey("absent"));
}

// Strings and objects read as written; a suite opened is a snapshot, suites are separate.
TYPED_TEST(DefaultsContractTest, ReadingsSnapshotsAndSeparateSuites) {
  this->h_.Set(kSuite, "device_name", "Kitchen");
  this->h_.Set(kSuite, "number", 42);
  this->h_.Set(kSuite, "flag", true);
  this->h_.Set(kSuite, "disable_reporting", "YES");
  auto before = this->h_.defaults->OpenSuite(kSuite);
  EXPECT_EQ(before->StringForKey("device_name"), "Kitchen");
  EXPECT_EQ(before->StringForKey("number"), "42");
  EXPECT_EQ(before->StringForKey("flag"), std::nullopt);
  EXPECT_EQ(before->StringForKey("absent"), std::nullopt);
  EXPECT_EQ(before->ObjectForKey("number"), Value(42));
  EXPECT_EQ(before->ObjectForKey("absent"), std::nullopt);

  this->h_.Remove(kSuite, "disable_reporting");
  this->h_.Set("other.suite", "disable_reporting", true);
  auto after = this->h_.defaults->OpenSuite(kSuite);
  EXPECT_TRUE(before->BoolForKey("disable_reporting"));
  EXPECT_EQ(after->ObjectForKey("disable_reporting"), std::nullopt);
  EXPECT_TRUE(this->h_.defaults->OpenSuite("other.suite")->BoolForKey("disable_reporting"));
  EXPECT_EQ(this->h_.defaults->OpenSuite("never.written")->ObjectForKey("x"), std::nullopt);
}

class LinuxDefaultsTest : public ::testing::Test {
 protected:
  std::string SuitePath() const { return DefaultsSuitePath(dir_.path(), kSuite); }
  std::string FileText() const { return testing::ReadFileText(SuitePath()); }

  testing::TempDir dir_;
  std::shared_ptr<testing::LogCapture> log_ = std::make_shared<testing::LogCapture>();
  std::shared_ptr<Defaults> defaults_ = NewLinuxDefaults({.state_dir = dir_.path(), .log = log_});
};

TEST_F(LinuxDefaultsTest, WritesOneJsonObjectPerSuiteAMissingOneReadsEmpty) {
  Dictionary read{{"stale", 1}};
  ASSERT_EQ(ReadSuite(dir_.path(), kSuite, read), std::nullopt);
  EXPECT_TRUE(read.empty());
  EXPECT_FALSE(defaults_->OpenSuite(kSuite)->BoolForKey("disable_reporting"));
  EXPECT_TRUE(log_->Lines().empty()) << "a missing suite is logged at debug level only";

  ASSERT_EQ(WriteDefault(dir_.path(), kSuite, "device_name", "Kitchen"), std::nullopt);
  ASSERT_EQ(WriteDefault(dir_.path(), kSuite, "disable_reporting", 1), std::nullopt);
  EXPECT_EQ(SuitePath(), dir_.path() + "/defaults/com.norvel.quenta.json");
  Value parsed;
  ASSERT_EQ(ParseJson(FileText(), parsed), std::nullopt);
  EXPECT_EQ(parsed, Value(Dictionary{{"device_name", "Kitchen"}, {"disable_reporting", 1}}));
  ASSERT_EQ(DeleteDefault(dir_.path(), kSuite, "device_name"), std::nullopt);
  ASSERT_EQ(DeleteDefault(dir_.path(), kSuite, "never-there"), std::nullopt);
  ASSERT_EQ(ReadSuite(dir_.path(), kSuite, read), std::nullopt);
  EXPECT_EQ(read, (Dictionary{{"disable_reporting", 1}}));
  // Only the suite and its lock file are left in the folder: no temporary files.
  const std::filesystem::directory_iterator files(dir_.File("defaults"));
  EXPECT_EQ(std::distance(begin(files), end(files)), 2);
}

TEST_F(LinuxDefaultsTest, MalformedSuiteReadsEmptyAndIsNotOverwritten) {
  std::filesystem::create_directories(dir_.File("defaults"));
  std::ofstream(SuitePath()) << "{\"disable_reporting\": YES}";
  auto suite = defaults_->OpenSuite(kSuite);
  EXPECT_EQ(suite->ObjectForKey("disable_reporting"), std::nullopt);
  ASSERT_EQ(log_->Lines().size(), 1u);
  EXPECT_EQ(log_->Lines()[0].level, LogLevel::kError);

  Dictionary read;
  auto error = ReadSuite(dir_.path(), kSuite, read);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, kDefaultsErrorDomain);
  EXPECT_TRUE(WriteDefault(dir_.path(), kSuite, "device_name", "x"));
  EXPECT_EQ(FileText(), "{\"disable_reporting\": YES}");
}

TEST_F(LinuxDefaultsTest, SuiteNamesCannotLeaveTheFolder) {
  for (const std::string& name :
       std::vector<std::string>{"", "../escape", "a/b", ".hidden", std::string(201, 'x')}) {
    Dictionary read;
    auto error = ReadSuite(dir_.path(), name, read);
    ASSERT_TRUE(error) << name;
    EXPECT_EQ(error->code, static_cast<std::int64_t>(DefaultsErrorCode::kInvalidSuiteName));
    EXPECT_TRUE(WriteDefault(dir_.path(), name, "k", 1)) << name;
    EXPECT_EQ(defaults_->OpenSuite(name)->ObjectForKey("k"), std::nullopt);
  }
  EXPECT_FALSE(std::filesystem::exists(dir_.File("escape.json")));
}

}  // namespace
}  // namespace qn
