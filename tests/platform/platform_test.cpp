// The Linux platform code beside the dispatcher: the log, the device-information file, the
// metrics text, and the notifications, defaults suites and driver counters, each with contract
// tests run against the Linux code and its fake.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "common/Json.h"
#include "platform/linux/linux_defaults.h"
#include "platform/linux/linux_device_info.h"
#include "platform/linux/linux_dispatch.h"
#include "platform/linux/linux_log.h"
#include "platform/linux/linux_metrics.h"
#include "platform/linux/linux_notify.h"
#include "platform/linux/linux_ostrel.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

// A file for a stream log to write to (writes to it never block).
struct LogFile {
  testing::TempDir dir;
  const int fd = ::open(dir.File("log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
  ~LogFile() { ::close(fd); }
  std::string Text() const { return testing::ReadFileText(dir.File("log")); }
};

std::shared_ptr<Log> StreamLog(int fd, std::string debug_scopes = "") {
  return NewLinuxLog({.sink = LinuxLogOptions::Sink::kStream,
                      .fd = fd,
                      .debug_scopes = std::move(debug_scopes),
                      .counters = nullptr,
                      .identifier = "qnreportingd"});
}

const LogScope* Register(Log& log, const char* code) {
  std::uint64_t n = 0;
  for (const char* p = code; *p; ++p) n = (n << 8) | static_cast<unsigned char>(*p);
  return log.RegisterScope(true, n, code, "com.norvel.quenta", "test", 31).get();
}

TEST(LinuxLogTest, StreamSinkWritesExactlyTheLine) {
  LogFile file;
  auto log = StreamLog(file.fd);
  const int line = __LINE__ + 1;
  QN_LOG(*log, nullptr, LogLevel::kInfo, "%s:%d:%s: created reporting session for ID: %lli", 42);
  QN_LOG_AS("QNReportingUtilityWait", *log, nullptr, LogLevel::kError, "%s:%d:%s: %@", "odd  %s");
  [&] { QN_LOG(*log, nullptr, LogLevel::kInfo, "%s:%d:%s: in a lambda"); }();
  const std::string function = "LinuxLogTest_StreamSinkWritesExactlyTheLine_Test::TestBody";
  const std::string expected =
      "platform_test.cpp:" + std::to_string(line) + ":" + function +
      ": created reporting session for ID: 42\nplatform_test.cpp:" + std::to_string(line + 1) +
      ":QNReportingUtilityWait: odd  %s\nplatform_test.cpp:" + std::to_string(line + 2) + ":" +
      function + ": in a lambda\n";
  EXPECT_EQ(file.Text(), expected);
}

// The function part of a line from either compiler's text of the function (this build
// shows only its own compiler's forms).
TEST(LinuxLogTest, FunctionPartNamesTheMethodThatMadeTheLine) {
  const std::pair<std::string_view, std::string_view> rows[] = {
      {"auto qn::QNReportingSession::writeSummaryJson()::(anonymous class)::operator()() const",
       "QNReportingSession::writeSummaryJson"},
      {"const char *qn::(anonymous namespace)::Name(std::map<int, int>)", "Name"},
      {"void qn::Holder<int>::Run(W) [W = int]", "Holder::Run"},
      {"bool qn::{anonymous}::Key::operator<(const qn::{anonymous}::Key&) const", "Key::operator<"},
      {"qn::<lambda()>", "qn::<lambda()>"}};
  for (const auto& [pretty, name] : rows) {
    std::string out;
    log_detail::ReadableFunctionName(pretty, [&](std::string_view part) { out += part; });
    EXPECT_EQ(out, name) << pretty;
  }
}

TEST(LinuxLogTest, DebugLinesOnlyForEnabledScopes) {
  LogFile file;
  auto log = StreamLog(file.fd, "qnrr, qnrd");
  const LogScope* session = Register(*log, "qnrr");
  const LogScope* server = Register(*log, "qnrs");
  EXPECT_TRUE(log->LogEnabled(session, 5));
  EXPECT_FALSE(log->LogEnabled(server, 5));
  EXPECT_FALSE(log->LogEnabled(nullptr, 5));
  for (int level = 0; level < 5; ++level) EXPECT_TRUE(log->LogEnabled(server, level));

  QN_LOG_AS("f", *log, session, LogLevel::kDebug, "%s:%d:%s: session debug");
  QN_LOG_AS("f", *log, server, LogLevel::kDebug, "%s:%d:%s: server debug");
  QN_LOG_AS("f", *log, nullptr, LogLevel::kDebug, "%s:%d:%s: default debug");
  QN_LOG_AS("f", *log, server, LogLevel::kDefault, "%s:%d:%s: server default");
  const std::string text = file.Text();
  EXPECT_NE(text.find("session debug"), std::string::npos);
  EXPECT_EQ(text.find("server debug"), std::string::npos);
  EXPECT_EQ(text.find("default debug"), std::string::npos);
  EXPECT_NE(text.find("server default"), std::string::npos);
}

TEST(LinuxLogTest, LinesFromManyThreadsNeverInterleave) {
  LogFile file;
  auto log = StreamLog(file.fd);
  constexpr int kThreads = 4;
  constexpr int kLines = 200;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kLines; ++i) {
        // Some lines are longer than a pipe's atomic write size: one write() per line.
        const std::string body(i % 10 == 0 ? 20000 : 50 + i, static_cast<char>('a' + t));
        log->Write(nullptr, LogLevel::kDefault, "f.cpp", 1, "f", body);
      }
    });
  }
  for (auto& t : threads) t.join();
  log.reset();
  std::istringstream text(file.Text());
  int lines = 0;
  for (std::string line; std::getline(text, line); ++lines) {
    ASSERT_EQ(line.find_first_not_of(line.at(0)), std::string::npos) << "two lines mixed in one";
  }
  EXPECT_EQ(lines, kThreads * kLines);
}

// Known figures get their Prometheus names and types, operations their short names and
// label values their escapes; a figure nobody described (added later) is still exposed.
TEST(PrometheusTextTest, KnownFiguresAreNamedAndOthersStillAppear) {
  const std::string text =
      PrometheusText(Dictionary{{"requests", Value(Dictionary{{"sendMessage:withCategory:", 3}})},
                                {"refused", Value(Dictionary{{"a\"b\\c\n", 1}})},
                                {"connections_open", 2},
                                {"pid", 77},
                                {"later", Value(Dictionary{{"lag_rows", 7}, {"state", "up"}})}});
  for (const char* line :
       {"# TYPE qnreportingd_requests_total counter\n",
        "qnreportingd_requests_total{op=\"sendMessage\"} 3\n",
        "qnreportingd_refused_total{limit=\"a\\\"b\\\\c\\n\"} 1\n",
        "# TYPE qnreportingd_connections gauge\nqnreportingd_connections 2\n",
        "# TYPE qnreportingd_later_lag_rows untyped\nqnreportingd_later_lag_rows 7\n"}) {
    EXPECT_NE(text.find(line), std::string::npos) << line << " in\n" << text;
  }
  EXPECT_EQ(text.find("77"), std::string::npos) << text;
  EXPECT_EQ(text.find("state"), std::string::npos) << text;
}

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

constexpr const char* kName = "com.norvel.quenta.reporting";

// What a handler saw: the token it was given and whether it ran on its queue.
struct Deliveries {
  std::mutex mu;
  std::vector<int> tokens;
  bool off_queue = false;
  testing::Counter count;

  std::function<void(int)> Handler(std::shared_ptr<SerialQueue> queue) {
    return [this, queue](int token) {
      {
        std::lock_guard lock(mu);
        tokens.push_back(token);
        off_queue = off_queue || !queue->IsCurrent();
      }
      count.Add();
    };
  }
};

struct LinuxNotifyHarness {
  testing::TempDir dir;
  std::shared_ptr<Notify> notify = NewLinuxNotify({.runtime_dir = dir.path(), .log = nullptr});
};

struct FakeNotifyHarness {
  std::shared_ptr<Notify> notify = std::make_shared<testing::FakeNotify>();
};

template <typename Harness>
class NotifyContractTest : public ::testing::Test {
 protected:
  std::shared_ptr<Dispatcher> dispatcher_ = NewLinuxDispatcher();
  std::shared_ptr<SerialQueue> queue_ =
      dispatcher_->CreateSerialQueue("server", QualityOfService::kUserInteractive);
  Harness h_;

  // Registers `seen` for `name` on `queue` (the server queue when null); returns its token.
  int Register(Deliveries& seen, const char* name = kName,
               std::shared_ptr<SerialQueue> queue = nullptr) {
    if (!queue) queue = queue_;
    int token = 0;
    EXPECT_EQ(h_.notify->Register(name, queue, seen.Handler(queue), &token), 0u);
    return token;
  }
};

using NotifyHarnesses = ::testing::Types<LinuxNotifyHarness, FakeNotifyHarness>;
TYPED_TEST_SUITE(NotifyContractTest, NotifyHarnesses);

// A post runs every live registration of its name on that registration's queue with its
// own token, again for every post; other names and cancelled registrations hear nothing.
TYPED_TEST(NotifyContractTest, PostRunsEveryLiveHandlerOfTheNameOnItsQueueWithItsToken) {
  Deliveries seen, other_queue, other_name, cancelled;
  const int token = this->Register(seen);
  const int cancelled_token = this->Register(cancelled);  // before `seen` on the same queue
  const int other_token = this->Register(
      other_queue, kName, this->dispatcher_->CreateSerialQueue("b", QualityOfService::kUtility));
  EXPECT_NE(token, this->Register(other_name, "other.name"));
  this->h_.notify->Cancel(cancelled_token);

  for (int post = 1; post <= 2; ++post) {
    ASSERT_EQ(this->h_.notify->Post(kName), 0u);
    ASSERT_TRUE(seen.count.WaitFor(post));
    ASSERT_TRUE(other_queue.count.WaitFor(post));
  }
  testing::Counter drained;  // whatever was queued on the server queue has run
  this->queue_->Async([&] { drained.Add(); });
  ASSERT_TRUE(drained.WaitFor(1));
  EXPECT_EQ(other_name.count.value() + cancelled.count.value(), 0);
  for (auto [d, t] : {std::pair{&seen, token}, std::pair{&other_queue, other_token}}) {
    std::lock_guard lock(d->mu);
    EXPECT_EQ(d->tokens, (std::vector<int>{t, t}));
    EXPECT_FALSE(d->off_queue);
  }
}

using LinuxNotifyTest = NotifyContractTest<LinuxNotifyHarness>;

TEST_F(LinuxNotifyTest, PostingTouchesAFileThatOtherProcessesSeeAndFifosDoNotHang) {
  Deliveries seen;
  Register(seen);
  // The command-line tool posts without a Notify object, from its own process.
  const pid_t child = ::fork();
  if (child == 0) ::_exit(PostNotification(h_.dir.path(), kName) == 0 ? 0 : 1);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  ASSERT_TRUE(seen.count.WaitFor(1));
  EXPECT_TRUE(std::filesystem::is_regular_file(h_.dir.File("notify/com.norvel.quenta.reporting")));
  // A FIFO under a name does not hang the poster.
  ASSERT_EQ(::mkfifo((h_.dir.path() + "/notify/fifo").c_str(), 0644), 0);
  EXPECT_EQ(h_.notify->Post("fifo"), kNotifyStatusFailed);
}

TEST(PostNotificationTest, NamesCannotLeaveTheFolder) {
  testing::TempDir dir;
  for (const std::string& name :
       std::vector<std::string>{"", ".", "..", "../x", "a/b", std::string(300, 'n')}) {
    EXPECT_EQ(PostNotification(dir.path(), name), kNotifyStatusInvalidName) << name;
  }
  EXPECT_FALSE(std::filesystem::exists(dir.File("x")));
}

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
  std::shared_ptr<testing::FakeDefaults> defaults = std::make_shared<testing::FakeDefaults>();
  void Set(const auto&... a) { defaults->Set(a...); }
  void Remove(const auto&... a) { defaults->Remove(a...); }
};

template <typename Harness>
class DefaultsContractTest : public ::testing::Test {
 protected:
  Harness h_;
};

using DefaultsHarnesses = ::testing::Types<LinuxDefaultsHarness, FakeDefaultsHarness>;
TYPED_TEST_SUITE(DefaultsContractTest, DefaultsHarnesses);

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
      {nullptr, false}};
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

// A missing suite reads empty (logged at debug level only); a suite is one JSON object in
// <state>/defaults, written without leaving temporary files (the qnreport tests write, read
// and delete values through the same calls).
TEST_F(LinuxDefaultsTest, WritesOneJsonObjectPerSuiteAMissingOneReadsEmpty) {
  EXPECT_FALSE(defaults_->OpenSuite(kSuite)->BoolForKey("disable_reporting"));
  EXPECT_TRUE(log_->Lines().empty());
  ASSERT_EQ(WriteDefault(dir_.path(), kSuite, "device_name", "Kitchen"), std::nullopt);
  ASSERT_EQ(WriteDefault(dir_.path(), kSuite, "disable_reporting", 1), std::nullopt);
  EXPECT_EQ(SuitePath(), dir_.path() + "/defaults/com.norvel.quenta.json");
  Value parsed;
  ASSERT_EQ(ParseJson(FileText(), parsed), std::nullopt);
  EXPECT_EQ(parsed, Value(Dictionary{{"device_name", "Kitchen"}, {"disable_reporting", 1}}));
  const std::filesystem::directory_iterator files(dir_.File("defaults"));
  EXPECT_EQ(std::distance(begin(files), end(files)), 2);  // the suite and its lock file
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
  std::shared_ptr<testing::FakeOstrel> ostrel = std::make_shared<testing::FakeOstrel>();
  void AddGroup(const auto&... a) { ostrel->AddGroup(a...); }
  void SetCounter(const auto&... a) { ostrel->SetCounter(a...); }
  void RemoveCounter(const auto&... a) { ostrel->RemoveCounter(a...); }
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

using OstrelHarnesses = ::testing::Types<LinuxOstrelHarness, FakeOstrelHarness>;
TYPED_TEST_SUITE(OstrelContractTest, OstrelHarnesses);

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
// of a counter that went away ENOENT.
TYPED_TEST(OstrelContractTest, FailuresCarryTheirCodes) {
  for (const char* c : {"a", "b", "c"}) this->h_.SetCounter("Speaker", "Amp", c, 1);
  auto s = this->Subscribe("Speaker", std::nullopt);
  std::optional<OstrelError> error;
  auto later = this->ostrel().CreateSamples(s.subscription.get(), s.channels, &error);
  ASSERT_TRUE(later);
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
  } cases[] = {{"  42 \n", 42},
               {"-5", -5},
               {"18446744073709551615\n", -1},  // an unsigned counter at its maximum
               {"", EBADMSG},
               {"twelve", EBADMSG},
               {"12 13", EBADMSG},
               {"0x10", EBADMSG},
               {"1e3", EBADMSG},
               {"99999999999999999999999", EBADMSG},
               {std::string(1000, '1'), EFBIG}};
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

// Only regular files inside the tree are channels: a FIFO is none (and does not hang the
// lookup); forged descriptions read nothing outside the tree.
TEST_F(LinuxOstrelTest, OnlyRegularFilesInsideTheTreeAreChannels) {
  Write("G/S/a", "1");
  Write("secret", "7");
  ASSERT_EQ(::mkfifo((dir_.path() + "/G/S/pipe").c_str(), 0644), 0);
  std::optional<OstrelError> error;
  auto channels = ostrel_->CopyChannelsInGroup("G", "S", 0, &error);
  ASSERT_TRUE(channels);
  EXPECT_EQ(ostrel_->GetChannelCount(*channels), 1);
  const Dictionary forged{
      {"G/S/../../secret",
       Dictionary{{"group", "G"}, {"subgroup", "S/../.."}, {"name", "secret"}}}};
  Dictionary subscribed{{"stale", 1}};
  auto subscription = ostrel_->CreateSubscription(forged, &subscribed);
  EXPECT_TRUE(subscribed.empty()) << "a forged channel was subscribed";
  EXPECT_EQ(ostrel_->CreateSamples(subscription.get(), forged, &error), std::nullopt);
  EXPECT_EQ(error.value_or(OstrelError{0}).code, EINVAL);
}

}  // namespace
}  // namespace qn
