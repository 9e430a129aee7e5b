#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/linux/linux_ostrel.h"
#include "tests/fakes/FakeOstrel.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

namespace fs = std::filesystem;

struct LinuxOstrelHarness {
  testing::TempDir dir;
  std::shared_ptr<Ostrel> ostrel = NewLinuxOstrel(dir.path());

  void AddGroup(const std::string& g, const std::string& s) {
    fs::create_directories(fs::path(dir.path()) / g / s);
  }
  void SetCounter(const std::string& g, const std::string& s, const std::string& c,
                  std::int64_t value) {
    AddGroup(g, s);
    std::ofstream(fs::path(dir.path()) / g / s / c) << value << "\n";
  }
  void RemoveCounter(const std::string& g, const std::string& s, const std::string& c) {
    fs::remove(fs::path(dir.path()) / g / s / c);
  }
};

struct FakeOstrelHarness {
  std::shared_ptr<testing::FakeOstrel> fake = std::make_shared<testing::FakeOstrel>();
  std::shared_ptr<Ostrel> ostrel = fake;

  void AddGroup(const std::string& g, const std::string& s) { fake->AddGroup(g, s); }
  void SetCounter(const std::string& g, const std::string& s, const std::string& c,
                  std::int64_t value) {
    fake->SetCounter(g, s, c, value);
  }
  void RemoveCounter(const std::string& g, const std::string& s, const std::string& c) {
    fake->RemoveCounter(g, s, c);
  }
};

template <typename Harness>
class OstrelContractTest : public ::testing::Test {
 protected:
  Ostrel& ostrel() { return *h_.ostrel; }

  // Looks up and subscribes, as the driver utility does.
  struct Subscribed {
    std::shared_ptr<OstrelSubscription> subscription;
    Dictionary channels;
  };
  Subscribed Subscribe(std::optional<std::string> group, std::optional<std::string> subgroup) {
    std::optional<OstrelError> error;
    auto channels = ostrel().CopyChannelsInGroup(group, subgroup, 0, &error);
    EXPECT_FALSE(error);
    Subscribed s;
    if (channels) s.subscription = ostrel().CreateSubscription(*channels, &s.channels);
    return s;
  }
  // name -> value of a samples dictionary, in the library's order.
  std::vector<std::pair<std::string, std::int64_t>> Walk(const Dictionary& samples) {
    std::vector<std::pair<std::string, std::int64_t>> out;
    ostrel().Iterate(samples, [&](const Value& sample) {
      out.emplace_back(ostrel().ChannelGetChannelName(sample).value_or("?"),
                       ostrel().SimpleGetIntegerValue(sample, 0));
      return 0;
    });
    return out;
  }

  Harness h_;
};

using Harnesses = ::testing::Types<LinuxOstrelHarness, FakeOstrelHarness>;
TYPED_TEST_SUITE(OstrelContractTest, Harnesses);

TYPED_TEST(OstrelContractTest, AbsentNamesInALookupMatchAny) {
  this->h_.SetCounter("Speaker", "A", "x", 1);
  this->h_.SetCounter("Speaker", "B", "y", 2);
  this->h_.SetCounter("Haptics", "Stats", "z", 3);
  this->h_.SetCounter("Other", "MCA", "w", 4);
  this->h_.SetCounter("NorvelKT5MCA", "MCA", "v", 5);
  this->h_.AddGroup("Empty", "Nothing");
  auto count = [&](std::optional<std::string> g, std::optional<std::string> s) {
    std::optional<OstrelError> error;
    auto channels = this->ostrel().CopyChannelsInGroup(g, s, 0, &error);
    EXPECT_FALSE(error);
    return channels ? this->ostrel().GetChannelCount(*channels) : -1;
  };
  EXPECT_EQ(count("Speaker", std::nullopt), 2);
  EXPECT_EQ(count(std::nullopt, "MCA"), 2);
  EXPECT_EQ(count("Haptics", "Stats"), 1);
  EXPECT_EQ(count(std::nullopt, std::nullopt), 5);
  EXPECT_EQ(count("Empty", std::nullopt), 0) << "an existing group without channels";
  EXPECT_EQ(count("Missing", std::nullopt), -1);
  EXPECT_EQ(count("Speaker", "Missing"), -1);
}

TYPED_TEST(OstrelContractTest, SamplesAndDeltasFollowTheCounters) {
  this->h_.SetCounter("Haptics", "Stats", "Underruns", 10);
  this->h_.SetCounter("Haptics", "Stats", "Overruns", 7);
  auto s = this->Subscribe("Haptics", "Stats");
  ASSERT_TRUE(s.subscription);
  ASSERT_EQ(this->ostrel().GetChannelCount(s.channels), 2);

  std::optional<OstrelError> error;
  auto earlier = this->ostrel().CreateSamples(s.subscription.get(), s.channels, &error);
  ASSERT_TRUE(earlier);
  ASSERT_FALSE(error);
  EXPECT_EQ(this->Walk(*earlier), (std::vector<std::pair<std::string, std::int64_t>>{
                                      {"Overruns", 7}, {"Underruns", 10}}));

  this->h_.SetCounter("Haptics", "Stats", "Underruns", 25);
  this->h_.SetCounter("Haptics", "Stats", "Overruns", 3);  // went down
  auto later = this->ostrel().CreateSamples(s.subscription.get(), s.channels, &error);
  ASSERT_TRUE(later);
  auto delta = this->ostrel().CreateSamplesDelta(&*earlier, *later, &error);
  ASSERT_TRUE(delta);
  ASSERT_FALSE(error);
  EXPECT_EQ(this->Walk(*delta), (std::vector<std::pair<std::string, std::int64_t>>{
                                    {"Overruns", -4}, {"Underruns", 15}}));
}

// A delta needs every earlier sample (ENODATA); sampling without a subscription is EBADF and
// of a counter that went away ENOENT; iteration stops when the callback says so.
TYPED_TEST(OstrelContractTest, FailuresCarryTheirCodesAndIterationStopsOnRequest) {
  for (const char* c : {"a", "b", "c"}) this->h_.SetCounter("Speaker", "Amp", c, 1);
  auto s = this->Subscribe("Speaker", std::nullopt);
  std::optional<OstrelError> error;
  auto later = this->ostrel().CreateSamples(s.subscription.get(), s.channels, &error);
  ASSERT_TRUE(later);
  int calls = 0;
  this->ostrel().Iterate(*later, [&](const Value&) { return ++calls == 2 ? 1 : 0; });
  EXPECT_EQ(calls, 2);

  const Dictionary lacking;
  auto fails = [&](auto result, int code) {
    EXPECT_EQ(result, std::nullopt);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, code);
    error.reset();
  };
  fails(this->ostrel().CreateSamplesDelta(nullptr, *later, &error), ENODATA);
  fails(this->ostrel().CreateSamplesDelta(&lacking, *later, &error), ENODATA);
  fails(this->ostrel().CreateSamples(nullptr, s.channels, &error), EBADF);
  this->h_.RemoveCounter("Speaker", "Amp", "b");
  fails(this->ostrel().CreateSamples(s.subscription.get(), s.channels, &error), ENOENT);
}

class LinuxOstrelTest : public ::testing::Test {
 protected:
  void Write(const std::string& rel, const std::string& text) {
    fs::create_directories((fs::path(dir_.path()) / rel).parent_path());
    std::ofstream(fs::path(dir_.path()) / rel) << text;
  }
  std::optional<Dictionary> Sample(std::optional<OstrelError>* error) {
    auto channels = ostrel_->CopyChannelsInGroup("G", "S", 0, error);
    if (!channels) return std::nullopt;
    Dictionary subscribed;
    auto subscription = ostrel_->CreateSubscription(*channels, &subscribed);
    return ostrel_->CreateSamples(subscription.get(), subscribed, error);
  }

  testing::TempDir dir_;
  std::shared_ptr<Ostrel> ostrel_ = NewLinuxOstrel(dir_.path());
};

TEST_F(LinuxOstrelTest, CounterTextsParseOrFailTheSampling) {
  Write("G/S/.hidden", "garbage");  // not a channel
  const struct {
    std::string text;
    std::int64_t value;  // or the sampling error's code
  } cases[] = {
      {"  42 \n", 42},
      {"-5", -5},
      {"18446744073709551615\n", -1},  // an unsigned counter at its maximum
      {"", EBADMSG},
      {"twelve", EBADMSG},
      {"12 13", EBADMSG},
      {"0x10", EBADMSG},
      {"1e3", EBADMSG},
      {"99999999999999999999999", EBADMSG},
      {std::string(1000, '1'), EFBIG},
  };
  for (const auto& c : cases) {
    Write("G/S/a", "1");
    Write("G/S/b", c.text);
    std::optional<OstrelError> error;
    auto samples = Sample(&error);
    if (samples) {
      ASSERT_EQ(samples->size(), 2u);
      EXPECT_EQ(ostrel_->SimpleGetIntegerValue(*samples->Find("G/S/b"), 0), c.value) << c.text;
    } else {
      ASSERT_TRUE(error) << c.text;
      EXPECT_EQ(error->code, c.value) << c.text;
    }
  }
}

TEST_F(LinuxOstrelTest, ForgedDescriptionsReadNothingOutsideTheTree) {
  Write("G/S/a", "1");
  Write("secret", "7");
  const Dictionary forged{
      {"G/S/../../secret",
       Dictionary{{"group", "G"}, {"subgroup", "S/../.."}, {"name", "secret"}}}};
  Dictionary subscribed{{"stale", 1}};
  auto subscription = ostrel_->CreateSubscription(forged, &subscribed);
  EXPECT_TRUE(subscribed.empty()) << "a forged channel was subscribed";
  std::optional<OstrelError> error;
  EXPECT_EQ(ostrel_->CreateSamples(subscription.get(), forged, &error), std::nullopt);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, EINVAL);
}

TEST_F(LinuxOstrelTest, AFifoAsACounterDoesNotHang) {
  Write("G/S/a", "1");
  fs::create_directories(dir_.File("G/S"));
  ASSERT_EQ(::mkfifo((dir_.path() + "/G/S/pipe").c_str(), 0644), 0);
  // Not a regular file: not a channel at all.
  std::optional<OstrelError> error;
  auto channels = ostrel_->CopyChannelsInGroup("G", "S", 0, &error);
  ASSERT_TRUE(channels);
  EXPECT_EQ(ostrel_->GetChannelCount(*channels), 1);
}

}  // namespace
}  // namespace qn
