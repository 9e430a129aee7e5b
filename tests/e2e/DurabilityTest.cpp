// What the daemon was handed survives its exit: summary files, stale temporary files, and
// every committed row after kill -9.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "common/Files.h"
#include "common/Json.h"
#include "tests/e2e/Daemon.h"
#include "tests/store/store_test_util.h"

namespace qn::e2e {
namespace {

using ::testing::EndsWith;

// The daemon on a --home of the caller's, so that files can be placed before it starts.
std::unique_ptr<Daemon> StartOn(const testing::TempDir& home, std::vector<std::string> args) {
  args.insert(args.begin(), {"--home", home.path()});
  return std::make_unique<Daemon>(args, home.File("run/reporting.sock"));
}

// The names in `dir`, sorted.
std::vector<std::string> NamesIn(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ec)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

TEST(DurabilityTest, SummaryFileIsInPlaceWhenTheStopReplyArrivesAndKillServiceKeepsIt) {
  testing::TempDir home;
  const std::string dir = home.File("log/DiagnosticLogs/Audio/Reporting");
  ASSERT_FALSE(CreateDirectories(dir, 0777));
  // What an earlier run left when it ended between writing and renaming.
  { std::ofstream(dir + "/.20240101-000000+0000-quenta-unknown-generic.json.tmp-7-0-1f") << "["; }
  auto daemon = StartOn(home, {"--internal-build"});
  ASSERT_TRUE(daemon->started());
  EXPECT_THAT(NamesIn(dir), ::testing::IsEmpty());

  struct Row {
    std::int64_t id;
    std::uint16_t serviceType;
    const char* suffix;
    bool killAfterReply;
  };
  auto client = daemon->Connect();
  ASSERT_TRUE(client);
  std::size_t expected = 0;
  for (const Row& row : {Row{1, 0, "-quenta-unknown-generic.json", false},
                         Row{2, 13, "-quenta-unknown-telephony.json", true}}) {
    SCOPED_TRACE(row.suffix);
    EXPECT_EQ(client->createReportingSessionSync(row.id), true);
    EXPECT_EQ(client->setServiceTypeSync(row.serviceType, row.id), true);
    client->startReportingSessionForID(row.id, nullptr);
    EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"n", row.id}}), 1, 1,
                                                            std::vector<std::int64_t>{row.id})));
    ASSERT_EQ(client->stopReportingSessionForIDSync(row.id), true);
    if (row.killAfterReply) {
      client->killService();
      EXPECT_EQ(daemon->process().Wait(), Exited(2));
    }
    const auto names = NamesIn(dir);
    ASSERT_EQ(names.size(), ++expected);
    const auto file = std::find_if(names.begin(), names.end(),
                                   [&](const auto& name) { return name.ends_with(row.suffix); });
    ASSERT_NE(file, names.end());
    Value content;
    EXPECT_FALSE(ParseJson(testing::ReadFileText(dir + "/" + *file), content));
    ASSERT_TRUE(content.as_array());
    EXPECT_EQ(content.as_array()->size(), 3u);  // userInfo, the message, the summary event
  }
}

// The "n" of every message row in the store at `db`.
std::set<std::int64_t> StoredNumbers(const std::string& db) {
  std::set<std::int64_t> numbers;
  for (const auto& row : RowsOf(testing::ReadRows(db), ReportingStoreRow::Table::kLivoMessage)) {
    const Value payload = Json(row.payload);
    const Value* n = payload.as_dictionary() ? payload.as_dictionary()->Find("n") : nullptr;
    if (n && n->as_int64()) numbers.insert(*n->as_int64());
  }
  return numbers;
}

std::string IntegrityCheck(const std::string& db) {
  sqlite3* handle = nullptr;
  std::string result = "cannot open";
  if (sqlite3_open_v2(db.c_str(), &handle, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_stmt* stmt = nullptr;
    sqlite3_prepare_v2(handle, "PRAGMA integrity_check", -1, &stmt, nullptr);
    result = sqlite3_step(stmt) == SQLITE_ROW
                 ? reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0))
                 : sqlite3_errmsg(handle);
    sqlite3_finalize(stmt);
  }
  sqlite3_close(handle);
  return result;
}

// kill -9 while pipelined messages pour in: what was committed before stays, the database
// is intact, and the restarted daemon serves and writes. How much acknowledged work the
// kill lost (messages, and microseconds before the kill) is recorded as test properties.
TEST(DurabilityTest, KillNineUnderLoadLosesNoCommittedRowAndTheRestartServes) {
  testing::TempDir home;
  const std::string db = home.File("state/reports.db");
  auto daemon = StartOn(home, {});
  ASSERT_TRUE(daemon->started());
  auto client = daemon->Connect();
  ASSERT_TRUE(client);
  ASSERT_EQ(client->createReportingSessionSync(1), true);
  client->startReportingSessionForID(1, nullptr);

  constexpr int kRounds = 12;
  constexpr int kPerRound = 500;
  std::map<std::int64_t, std::chrono::steady_clock::time_point> acknowledged;
  std::mutex mu;
  std::set<std::int64_t> committed;
  auto acknowledge = [&](std::int64_t n) {
    std::lock_guard lock(mu);
    acknowledged[n] = std::chrono::steady_clock::now();
  };
  for (std::int64_t n = 0; n < kRounds * kPerRound; ++n) {
    Value message(Dictionary{{"n", n}});
    if ((n + 1) % kPerRound != 0) {
      client->sendMessage(message, 1, 1, std::vector<std::int64_t>{1},
                          [&, n](const auto& error) { error ? void() : acknowledge(n); });
      continue;
    }
    // A round ends with a reply awaited; the replies to the round came before it.
    ASSERT_TRUE(RepliedWithoutError(client->sendMessageSync(message, 1, 1, {{1}})));
    acknowledge(n);
    if (n + 1 == kRounds * kPerRound / 2) committed = StoredNumbers(db);
  }
  daemon->process().Signal(SIGKILL);
  const auto killed = std::chrono::steady_clock::now();
  ASSERT_EQ(daemon->process().Wait(), (ExitStatus{false, SIGKILL}));
  client.reset();
  EXPECT_EQ(acknowledged.size(), static_cast<std::size_t>(kRounds * kPerRound));
  EXPECT_EQ(IntegrityCheck(db), "ok");
  const std::set<std::int64_t> stored = StoredNumbers(db);
  EXPECT_FALSE(committed.empty());
  EXPECT_TRUE(std::includes(stored.begin(), stored.end(), committed.begin(), committed.end()));
  std::size_t lost = 0;
  auto oldest_lost = killed;
  for (const auto& [n, when] : acknowledged) {
    if (stored.count(n)) continue;
    ++lost;
    oldest_lost = std::min(oldest_lost, when);
  }
  ::testing::Test::RecordProperty("acknowledged", static_cast<int>(acknowledged.size()));
  ::testing::Test::RecordProperty("lost_acknowledged", static_cast<int>(lost));
  ::testing::Test::RecordProperty(
      "lost_window_us",
      static_cast<int>(
          std::chrono::duration_cast<std::chrono::microseconds>(killed - oldest_lost).count()));

  auto restarted = StartOn(home, {});
  ASSERT_TRUE(restarted->started());
  auto again = restarted->Connect();
  ASSERT_TRUE(again);
  ASSERT_EQ(again->createReportingSessionSync(2), true);
  again->startReportingSessionForID(2, nullptr);
  const std::int64_t after = kRounds * kPerRound;
  EXPECT_TRUE(RepliedWithoutError(
      again->sendMessageSync(Value(Dictionary{{"n", after}}), 1, 1, std::vector<std::int64_t>{2})));
  again.reset();
  EXPECT_EQ(restarted->Stop(), Exited(0));
  const std::set<std::int64_t> final_rows = StoredNumbers(db);
  EXPECT_TRUE(final_rows.count(after));
  EXPECT_TRUE(std::includes(final_rows.begin(), final_rows.end(), stored.begin(), stored.end()));
  EXPECT_EQ(IntegrityCheck(db), "ok");
}

}  // namespace
}  // namespace qn::e2e
