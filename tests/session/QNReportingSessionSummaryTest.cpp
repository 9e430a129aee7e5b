// The session summary event and the summary file written at stop.
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "common/Json.h"
#include "tests/fakes/TempDir.h"
#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using testing::Payload;
using testing::ReadFileText;

// Summary files go to a temporary folder.
class SummaryTest : public testing::SessionFixture {
 protected:
  SummaryTest() { t_.platform->diagnostic_logs_dir = tmp_.File("DiagnosticLogs/Audio/Reporting"); }

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

TEST_F(SummaryTest, SummaryJoinsValuesPerKeyInPayloadOrder) {
  auto session = NewSession(42, 3);
  session->start();
  session->sendMessage(Payload({{"a", 1}}), 1, 0, nullptr);
  session->sendMessage(Payload({{"a", 2}, {"b", "x"}}), 1, 0, nullptr);
  session->sendMessage(Payload({{"a", 1}}), 1, 0, nullptr);  // neither summed nor deduplicated
  auto summary = session->createSummaryEventForSession();
  ASSERT_TRUE(summary);
  EXPECT_EQ(*summary, (Dictionary{{"QN_Session_Summary_Event", "3"}, {"a", "1,2,1"}, {"b", "x"}}));
  std::vector<std::string> keys;
  for (const auto& [k, v] : *summary) keys.push_back(k.Description());
  EXPECT_THAT(keys, ElementsAre("QN_Session_Summary_Event", "a", "b"));
  // Reading changes nothing.
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().size(), 3u);
}

TEST_F(SummaryTest, StopSendsSummaryThroughTheSessionBeforeItsFlushAndCountsIt) {
  auto session = OneMessageSession(3);
  auto lines = t_.log->Lines();
  auto it = std::find_if(lines.begin(), lines.end(), [](const auto& l) {
    return l.text.find("sending summary event") != std::string::npos;
  });
  ASSERT_NE(it, lines.end());
  EXPECT_THAT(it->text, MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*stop.*: sending summary "
                                     "event for reporter 42"));
  EXPECT_EQ(it->level, LogLevel::kDefault);
  // The message and the summary event went through the framework session before the end
  // sequence flushed and dropped it.
  auto framework = t_.livo->Sessions();
  ASSERT_EQ(framework.size(), 1u);
  EXPECT_EQ(framework[0].flushes, 1);
  auto messages = framework[0].messages;
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[1].category, 0xFFFF);
  EXPECT_EQ(messages[1].type, 0xFFFF);
  EXPECT_EQ(messages[1].payload, Value(Dictionary{{"QN_Session_Summary_Event", "3"}, {"a", "1"}}));
  EXPECT_EQ(*session->messageTypeCounts()->Find("Undefined_Unknown"), Value(1));
}

TEST_F(SummaryTest, InternalBuildWritesPrettyJsonWithUserInfoFirst) {
  SetInternal(true);
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
  ASSERT_EQ(stat(t_.platform->diagnostic_logs_dir.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0777u);
  ASSERT_EQ(stat(tmp_.File("DiagnosticLogs").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0777u);
  for (const auto& l : t_.log->Lines()) EXPECT_NE(l.level, LogLevel::kError) << l.text;
}

TEST_F(SummaryTest, CustomerBuildWritesNothing) {
  SetInternal(false);
  OneMessageSession(2);
  EXPECT_FALSE(fs::exists(tmp_.File("DiagnosticLogs")));
  EXPECT_EQ(t_.livo->AllSessionMessages().size(), 2u);  // the summary event still went out
}

TEST_F(SummaryTest, HostAppCannotLeadOutOfTheDirectory) {
  SetInternal(true);
  OneMessageSession(0, {{"HostApplicationDisplayID", "../../escape"}});
  auto files = SummaryFiles();
  ASSERT_EQ(files.size(), 1u);
  EXPECT_THAT(files[0].filename().string(),
              MatchesRegex(".*-quenta-\\.\\._\\.\\._escape-generic\\.json"));
}

TEST_F(SummaryTest, BlockedDirectoryIsLoggedAndStopGoesOn) {
  SetInternal(true);
  { std::ofstream(tmp_.File("blocked")) << "x"; }
  const std::string dir = tmp_.File("blocked/Reporting");
  t_.platform->diagnostic_logs_dir = dir;
  auto session = OneMessageSession(0);
  auto dirLines = t_.log->Matching("can't create logging directory");
  ASSERT_EQ(dirLines.size(), 1u);
  EXPECT_THAT(dirLines[0], MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*: can't create logging "
                                        "directory at " +
                                        dir + ": .+"));
  EXPECT_EQ(t_.log->Count(": jsonOutput writeToURL: "), 1);
  int errors = 0;
  for (const auto& l : t_.log->Lines()) errors += l.level == LogLevel::kError;
  EXPECT_EQ(errors, 2);
  EXPECT_FALSE(session->started());
  EXPECT_EQ(t_.livo->Sessions()[0].flushes, 1);
}

}  // namespace
}  // namespace qn
