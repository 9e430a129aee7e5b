// What a session aggregates (messages, orientation changes) and the summary event and file
// made of it at stop.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include "common/Json.h"
#include "tests/fakes/TempDir.h"
#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using testing::Payload;
using testing::ReadFileText;
using namespace std::chrono_literals;

// Summary files go to a temporary folder.
class SummaryTest : public testing::SessionFixture {
 protected:
  SummaryTest() {
    t_.platform->log_dir = tmp_.path();
    t_.platform->diagnostic_logs_dir = tmp_.File("DiagnosticLogs/Audio/Reporting");
  }

  std::vector<fs::path> SummaryFiles() const {
    std::vector<fs::path> files;
    std::error_code ec;
    for (const auto& e : fs::directory_iterator(t_.platform->diagnostic_logs_dir, ec)) {
      files.push_back(e.path());
    }
    return files;
  }
  // Runs a session of `serviceType` with the message {"a": 1} (category 1) from start to
  // stop, its queued work included.
  std::shared_ptr<QNReportingSession> OneMessageSession(std::uint16_t serviceType,
                                                        Dictionary configuration = {}) {
    auto session = NewSession(42, serviceType);
    if (!configuration.empty()) session->setConfiguration(Payload(std::move(configuration)));
    session->start();
    session->sendMessage(Payload({{"a", 1}}), 1, 0, nullptr);
    session->stop();
    t_.dispatcher->RunUntilIdle();
    return session;
  }

  testing::TempDir tmp_;
};

// The summary joins the values per key in payload order (neither summed nor deduplicated);
// at stop it goes through the framework session before the flush, counted as a message.
TEST_F(SummaryTest, SummaryJoinsValuesPerKeyAndGoesOutBeforeTheFlush) {
  auto session = NewSession(42, 3);
  session->start();
  session->sendMessage(Payload({{"a", 1}}), 1, 0, nullptr);
  session->sendMessage(Payload({{"a", 2}, {"b", "x"}}), 1, 0, nullptr);
  session->sendMessage(Payload({{"a", 1}}), 1, 0, nullptr);
  const Dictionary expected{{"QN_Session_Summary_Event", "3"}, {"a", "1,2,1"}, {"b", "x"}};
  auto summary = session->createSummaryEventForSession();
  ASSERT_TRUE(summary);
  EXPECT_EQ(*summary, expected);
  std::vector<std::string> keys;
  for (const auto& [k, v] : *summary) keys.push_back(k.Description());
  EXPECT_THAT(keys, ElementsAre("QN_Session_Summary_Event", "a", "b"));
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().size(), 3u);  // reading changes nothing

  session->stop();
  t_.dispatcher->RunUntilIdle();
  EXPECT_THAT(t_.log->Matching("sending summary event"),
              ElementsAre(MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*stop.*: sending summary "
                                       "event for reporter 42")));
  auto framework = t_.livo->Sessions();
  ASSERT_EQ(framework.size(), 1u);
  EXPECT_EQ(framework[0].flushes, 1);
  ASSERT_EQ(framework[0].messages.size(), 4u);
  const auto& event = framework[0].messages[3];
  EXPECT_EQ(event.category, 0xFFFF);
  EXPECT_EQ(event.type, 0xFFFF);
  EXPECT_EQ(event.payload, Value(expected));
  EXPECT_EQ(*session->messageTypeCounts().Find("Undefined_Unknown"), Value(1));
}

TEST_F(SummaryTest, InternalBuildWritesPrettyJsonWithUserInfoFirstInsideItsFolder) {
  SetInternal(true);
  // A folder an earlier version made for anyone to write to is narrowed to 0750.
  fs::create_directories(tmp_.File("DiagnosticLogs"));
  fs::permissions(tmp_.File("DiagnosticLogs"), fs::perms::all);
  auto session = NewSession(42, 0);
  session->setConfiguration(Payload({{"HostApplicationDisplayID", "org.example.app"}}));
  session->start();
  t_.dispatcher->RunUntilIdle();
  session->sendMessage(Payload({{"a b", 1}}), 5, 1, nullptr);
  session->stop();
  // Without a summary queue the file is in place once stop returns, before any queued work.
  auto files = SummaryFiles();
  ASSERT_EQ(files.size(), 1u);
  EXPECT_THAT(
      files[0].filename().string(),
      MatchesRegex("[0-9]{8}-[0-9]{6}[-+][0-9]{4}-quenta-org\\.example\\.app-generic\\.json"));
  Value expected(
      Array{Value(Dictionary{{"HostApplicationDisplayID", "org.example.app"}}),
            Value(Dictionary{{"Setup_Start_1", Dictionary{{"a_b", 1}}}}),
            Value(Dictionary{{"Undefined_Unknown_1",
                              Dictionary{{"QN_Session_Summary_Event", "0"}, {"a_b", "1"}}}})});
  std::string expected_text;
  ASSERT_FALSE(ToJson(expected, JsonStyle::kPretty, expected_text));
  EXPECT_EQ(ReadFileText(files[0]), expected_text);
  EXPECT_THAT(expected_text, HasSubstr("\n"));

  struct stat st {};
  for (const std::string& folder :
       {t_.platform->diagnostic_logs_dir, tmp_.File("DiagnosticLogs")}) {
    ASSERT_EQ(stat(folder.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0750u) << folder;
  }
  ASSERT_EQ(stat(files[0].c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  for (const auto& l : t_.log->Lines()) EXPECT_NE(l.level, LogLevel::kError) << l.text;

  // A host application name cannot lead out of the folder.
  OneMessageSession(0, {{"HostApplicationDisplayID", "../../escape"}});
  files = SummaryFiles();
  EXPECT_EQ(t_.device_info->Asked("InternalBuild"), 1);  // asked once, then kept
  ASSERT_EQ(files.size(), 2u);
  EXPECT_TRUE(files[0].filename().string().ends_with("-quenta-.._.._escape-generic.json") ||
              files[1].filename().string().ends_with("-quenta-.._.._escape-generic.json"));
}

TEST_F(SummaryTest, CustomerBuildWritesNothing) {
  SetInternal(false);
  OneMessageSession(2);
  EXPECT_FALSE(fs::exists(tmp_.File("DiagnosticLogs")));
  EXPECT_EQ(t_.livo->AllSessionMessages().size(), 2u);  // the summary event still went out
}

// A folder on the way to the summary folder that is not the daemon's own: a file, or (made
// by a child dropped to uid 65534, as a neighbour on the machine would) a symbolic link to
// a folder elsewhere or a folder of that user. The write is refused, lands nowhere, both
// errors are logged and the stop goes on.
TEST_F(SummaryTest, FolderNotOurOwnIsRefusedAndStopGoesOn) {
  SetInternal(true);
  const std::string planted = tmp_.File("DiagnosticLogs"), elsewhere = tmp_.File("elsewhere");
  fs::create_directories(elsewhere);
  fs::permissions(tmp_.path(), fs::perms::all);  // the neighbour may write in the log folder
  fs::permissions(elsewhere, fs::perms::all);
  const auto asNobody = [](const std::function<int()>& plant) {
    const pid_t child = fork();
    if (child == 0) _exit(setgid(65534) == 0 && setuid(65534) == 0 && plant() == 0 ? 0 : 1);
    int status = -1;
    waitpid(child, &status, 0);
    return status == 0;
  };
  const struct {
    const char* what;
    std::function<bool()> plant;
    bool needsRoot;
  } cases[] = {
      {"a file", [&] { return std::ofstream(planted) << "x", true; }, false},
      {"a symbolic link",
       [&] { return asNobody([&] { return symlink(elsewhere.c_str(), planted.c_str()); }); }, true},
      {"another user's folder",
       [&] { return asNobody([&] { return mkdir(planted.c_str(), 0777); }); }, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    if (c.needsRoot && geteuid() != 0) continue;
    fs::remove_all(planted);
    t_.log->Clear();
    ASSERT_TRUE(c.plant());
    auto session = OneMessageSession(0);
    auto dirLines = t_.log->Matching("can't create logging directory");
    ASSERT_EQ(dirLines.size(), 1u);
    EXPECT_THAT(dirLines[0], MatchesRegex("QNReportingSession\\.cpp:[0-9]+:QNReportingSession::"
                                          "writeSummaryJson: can't create logging directory at " +
                                          t_.platform->diagnostic_logs_dir + ": .+"));
    EXPECT_EQ(t_.log->Count(":QNReportingSession::writeSummaryJson: jsonOutput writeToURL: "), 1);
    int errors = 0;
    for (const auto& l : t_.log->Lines()) errors += l.level == LogLevel::kError;
    EXPECT_EQ(errors, 2);
    EXPECT_FALSE(session->started());
    EXPECT_EQ(t_.livo->Sessions().back().flushes, 1);
    EXPECT_TRUE(fs::is_empty(elsewhere));
  }
}

// After each write the folder keeps at most its limits, the oldest files (by modification
// time) removed first, never the file just written; hidden and other files are left alone.
TEST_F(SummaryTest, OldestSummaryFilesGoBeyondTheLimits) {
  SetInternal(true);
  const std::string dir = t_.platform->diagnostic_logs_dir;
  const struct {
    std::size_t maxFiles;
    std::uint64_t maxBytes;
    std::vector<std::string> left;  // of the files there before
  } cases[] = {
      {2, 1u << 20, {"a.json"}},  // the newest; by name it would be c.json
      {10, 1, {}},                // the new file alone is over the limit, and stays
      {10, 1u << 20, {"a.json", "b.json", "c.json"}},
  };
  for (const auto& c : cases) {
    fs::remove_all(tmp_.File("DiagnosticLogs"));
    fs::create_directories(dir);
    const auto now = fs::file_time_type::clock::now();
    for (const auto& [name, age] : {std::pair{"c.json", 3}, {"a.json", 1}, {"b.json", 2}}) {
      std::ofstream(dir + "/" + name) << "0123456789";
      fs::last_write_time(dir + "/" + name, now - std::chrono::minutes(age));
    }
    std::ofstream(dir + "/.x.json.tmp-1") << "x";
    std::ofstream(dir + "/notes.txt") << "x";
    t_.platform->max_summary_files = c.maxFiles;
    t_.platform->max_summary_bytes = c.maxBytes;
    const auto removedBefore = Counters::Get(t_.platform->counters->summaryFilesRemoved);
    OneMessageSession(0);
    std::vector<::testing::Matcher<std::string>> left{".x.json.tmp-1", "notes.txt",
                                                      EndsWith("-quenta-unknown-generic.json")};
    left.insert(left.end(), c.left.begin(), c.left.end());
    std::vector<std::string> names;
    for (const auto& f : SummaryFiles()) names.push_back(f.filename().string());
    EXPECT_THAT(names, ::testing::UnorderedElementsAreArray(left));
    const auto removed = 3 - c.left.size();
    EXPECT_EQ(Counters::Get(t_.platform->counters->summaryFilesRemoved), removedBefore + removed);
    EXPECT_EQ(t_.log->Count("oldest summary files"), removed ? 1 : 0);
    t_.log->Clear();
  }
}

TEST_F(SummaryTest, ChangesFiledInSecondsUnregisteredAtStop) {
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
      ElementsAre(
          MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*: Orientation handler callback "
                       "mode=device orientation=\"LandscapeLeft\" app=\"org.example.phone\", "
                       "time=1.234, id=\"QNReportingService 42\""),
          EndsWith(": Orientation handler callback mode=ui "
                   "orientation=\"Portrait\" app=\"org.example.phone\", "
                   "time=2, id=\"QNReportingService 42\""),
          HasSubstr("time=2.001,")));

  session->stop();
  EXPECT_FALSE(session->orientationCallbackID());
  EXPECT_THAT(t_.orientation->Events(), ElementsAre("register device QNReportingService 42",
                                                    "register ui QNReportingService 42",
                                                    "unregister device QNReportingService 42",
                                                    "unregister ui QNReportingService 42"));
  EXPECT_EQ(t_.orientation->FireDevice(1) + t_.orientation->FireUI(1), 0);
  t_.dispatcher->RunUntilIdle();
}

TEST_F(SummaryTest, CallbacksRaceWithIntakeAndStop) {
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

// Beyond the aggregation cap a payload is still delivered but left out of the summary, with
// one error line per started period; the counter counts each payload left out.
TEST_F(SummaryTest, PayloadsBeyondTheAggregationCapAreDeliveredButNotSummarised) {
  t_.platform->max_aggregated_bytes = 2 * Value(Dictionary{{"a", 1}}).ApproximateBytes();
  const std::string line = "session 42 holds " + std::to_string(t_.platform->max_aggregated_bytes) +
                           " bytes of payloads, the most it aggregates; later messages are "
                           "delivered but left out of its summary";
  auto session = NewSession(42, 3);
  const Counters& counters = *t_.platform->counters;
  for (int period = 1; period <= 2; ++period) {
    session->start();
    const auto delivered = t_.livo->AllSessionMessages().size();
    const auto capped = Counters::Get(counters.aggregationCapped);
    for (int i = 1; i <= 4; ++i) session->sendMessage(Payload({{"a", i}}), 1, 0, nullptr);
    t_.dispatcher->RunUntilIdle();
    EXPECT_EQ(t_.livo->AllSessionMessages().size(), delivered + 4);
    EXPECT_EQ(*session->createSummaryEventForSession(),
              (Dictionary{{"QN_Session_Summary_Event", "3"}, {"a", "1,2"}}));
    EXPECT_EQ(Counters::Get(counters.aggregationCapped), capped + 2);
    session->stop();  // the summary event, itself beyond the cap, is counted too
    t_.dispatcher->RunUntilIdle();
  }
  EXPECT_THAT(t_.log->Matching("the most it aggregates"),
              ElementsAre(MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*sendMessage.*: " + line),
                          EndsWith(": " + line)));
  for (const auto& l : t_.log->Lines()) {
    EXPECT_TRUE(l.level == LogLevel::kError || !l.text.ends_with(line)) << l.text;
  }
}

// A configuration that would take its session, the sessions of its creator's uid, or all
// sessions past their cap is acknowledged but not merged; one uid's cap does not hold back
// the sessions of another.
TEST_F(SummaryTest, ConfigurationsBeyondACapAreNotMerged) {
  const std::size_t one = Value(Dictionary{{"k1", 1}}).ApproximateBytes();
  const std::size_t two = Value(Dictionary{{"k1", 1}, {"k2", 2}}).ApproximateBytes();
  const Counters& counters = *t_.platform->counters;
  struct {
    std::size_t Platform::*cap;
    std::size_t value;
    bool firstMerges, secondMerges, otherUidMerges;  // the last configuration of each
    std::uint64_t capped;
  } cases[] = {
      {&Platform::max_configuration_bytes, two - 1, false, false, true, 2},
      {&Platform::max_configuration_bytes_per_uid, two + one, true, false, true, 1},
      {&Platform::max_configuration_bytes_total, two + one, true, false, false, 2},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.value);
    const auto held = static_cast<std::size_t>(Counters::Get(counters.configurationBytes));
    (*t_.platform).*c.cap =
        c.value + (c.cap == &Platform::max_configuration_bytes_total ? held : 0);
    const std::uint64_t capped = Counters::Get(counters.configurationCapped);
    const auto uid = std::make_shared<HeldBytes>(), other = std::make_shared<HeldBytes>();
    const auto created = [&](const std::shared_ptr<HeldBytes>& account, std::int64_t id) {
      const HeldBytes::Charge charge(account);
      return NewSession(id, 3);
    };
    auto first = created(uid, 1), second = created(uid, 2), third = created(other, 3);
    first->setConfiguration(Payload({{"k1", 1}}));
    first->setConfiguration(Payload({{"k2", 2}}));
    second->setConfiguration(Payload({{"k1", 1}}));
    second->setConfiguration(Payload({{"k2", 2}}));
    third->setConfiguration(Payload({{"k1", 1}}));
    EXPECT_EQ(first->userInfo()->Contains("k2"), c.firstMerges);
    EXPECT_EQ(second->userInfo()->Contains("k2"), c.secondMerges);
    EXPECT_EQ(third->userInfo()->Contains("k1"), c.otherUidMerges);
    EXPECT_EQ(Counters::Get(counters.configurationCapped), capped + c.capped);
    EXPECT_EQ(uid->Get(HeldBytes::kConfiguration),
              static_cast<std::int64_t>((c.firstMerges ? two : one) + one));
    (*t_.platform).*c.cap = SIZE_MAX;
  }
}

}  // namespace
}  // namespace qn
