// The store's layout and its migrations: analytics events that repeat a message refer to
// it and read back byte for byte; a version 1 file migrates in place with every row
// readable as before; a newer file is refused untouched; a migration killed half-way
// leaves the file as it was.
#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "common/Json.h"
#include "platform/linux/store_sinks.h"
#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ReadRows;
using testing::WriterGate;

// Every row of `sql` with its columns joined by '|' (NULL as "~").
std::vector<std::string> Query(const std::string& db_path, const std::string& sql) {
  std::vector<std::string> rows;
  sqlite3* db = nullptr;
  EXPECT_EQ(sqlite3_open_v2(db_path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
  sqlite3_stmt* stmt = nullptr;
  EXPECT_EQ(sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr), SQLITE_OK)
      << sql << ": " << sqlite3_errmsg(db);
  while (stmt && sqlite3_step(stmt) == SQLITE_ROW) {
    std::string row;
    for (int i = 0; i < sqlite3_column_count(stmt); ++i) {
      const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(stmt, i));
      row += (i ? "|" : "") + std::string(text ? text : "~");
    }
    rows.push_back(row);
  }
  sqlite3_finalize(stmt);
  sqlite3_close(db);
  return rows;
}

void Exec(const std::string& db_path, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(db_path.c_str(), &db), SQLITE_OK);
  char* message = nullptr;
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, &message), SQLITE_OK)
      << (message ? message : "");
  sqlite3_free(message);
  sqlite3_close(db);
}

// A version 1 store as the first layout's writer left it: 16 KiB pages, WAL, its four
// tables, and `messages` rows besides a few of every kind.
void MakeVersion1Store(const std::string& path, int messages) {
  Exec(path, R"sql(
PRAGMA page_size=16384;
PRAGMA journal_mode=WAL;
CREATE TABLE livo_sessions(id INTEGER PRIMARY KEY, session_info TEXT NOT NULL,
  user_info TEXT NOT NULL, created REAL NOT NULL, flushed REAL);
CREATE TABLE livo_messages(id INTEGER PRIMARY KEY, session INTEGER REFERENCES livo_sessions(id),
  category INTEGER NOT NULL, type INTEGER NOT NULL, payload TEXT NOT NULL, session_info TEXT,
  user_info TEXT, time REAL NOT NULL);
CREATE TABLE analytics_events(id INTEGER PRIMARY KEY, name TEXT NOT NULL, payload TEXT NOT NULL,
  time REAL NOT NULL);
CREATE TABLE powerlog_events(id INTEGER PRIMARY KEY, subsystem INTEGER NOT NULL,
  name TEXT NOT NULL, payload TEXT NOT NULL, time REAL NOT NULL);
PRAGMA user_version = 1;
BEGIN;
INSERT INTO livo_sessions VALUES(1, '{"ClientType":3}', '{"HostApplicationDisplayID":"app"}',
  100.5, 101.25);
INSERT INTO livo_sessions VALUES(2, '{}', '{}', 102, NULL);
INSERT INTO livo_messages VALUES(1, 1, 5, 1, '{"route":"speaker","level":0.5}', NULL, NULL, 100.75);
INSERT INTO livo_messages VALUES(2, NULL, 9, 0, '{"a":[1,2]}', '{"SessionID":-1}',
  '{"ClientName":"com.norvel.quenta"}', 101);
INSERT INTO analytics_events VALUES(1, 'com.norvel.quenta.Volume.Stop',
  '{"route":"speaker","HostApplicationDisplayID":"app"}', 100.8);
INSERT INTO powerlog_events VALUES(1, 28, 'Vistrel_Haptics', '{"EngineOnDuration":3}', 101.5);
WITH RECURSIVE n(i) AS (SELECT 3 UNION ALL SELECT i + 1 FROM n WHERE i < )sql" +
                 std::to_string(messages + 2) + R"sql()
  INSERT INTO livo_messages SELECT i, 2, 1, 1, '{"filler":"' || hex(randomblob(100)) || '"}',
    NULL, NULL, 103 + i FROM n;
COMMIT;
)sql");
}

// Every view's rows in id order, and every row as the reader (qnreport events) gives it.
struct Contents {
  std::vector<std::string> views;
  std::vector<std::string> read;

  static Contents Of(const std::string& path) {
    Contents c;
    for (const char* view :
         {"livo_sessions", "livo_messages", "analytics_events", "powerlog_events"}) {
      for (auto& row : Query(path, std::string("SELECT * FROM ") + view + " ORDER BY id")) {
        c.views.push_back(view + ("|" + row));
      }
    }
    for (const auto& row : ReadRows(path)) {
      c.read.push_back(std::string(row.table_name()) + "|" + std::to_string(row.id) + "|" +
                       std::to_string(row.time) + "|" + row.name + "|" + row.payload + "|" +
                       row.session_info + "|" + row.user_info);
    }
    return c;
  }
  bool operator==(const Contents&) const = default;
};

using SchemaTest = testing::StoreTest;

TEST_F(SchemaTest, AnalyticsEventsThatRepeatAMessageReferToItAndReadBackTheSame) {
  struct Case {
    const char* what;
    Dictionary message;
    Dictionary event;  // the analytics event's payload
    bool refers;
  };
  const Dictionary nested{{"d", 1.5}, {"z", -0.0}, {"s", "\xC3\xA9 \"q\"\n\\"}, {"n", Value()}};
  const Case cases[] = {
      {"plain",
       {{"a", 1}, {"b", "x"}},
       {{"a", 1}, {"b", "x"}, {"HostApplicationDisplayID", "App"}},
       true},
      {"empty", {}, {{"HostApplicationDisplayID", "Unknown"}}, true},
      {"nested values and escapes",
       {{"n", nested}, {"arr", Array{1, 2.0, "3"}}},
       {{"n", nested}, {"arr", Array{1, 2.0, "3"}}, {"HostApplicationDisplayID", "App"}},
       true},
      {"host replaced in place",
       {{"x", 1}, {"HostApplicationDisplayID", "old"}, {"y", 2}},
       {{"x", 1}, {"HostApplicationDisplayID", "App"}, {"y", 2}},
       true},
      {"a value differs", {{"a", 1}}, {{"a", 2}, {"HostApplicationDisplayID", "App"}}, false},
      {"an integer where a double was",
       {{"i", 1.0}},
       {{"i", 1}, {"HostApplicationDisplayID", "App"}},
       false},
      {"keys in another order",
       {{"a", 1}, {"b", 2}},
       {{"b", 2}, {"a", 1}, {"HostApplicationDisplayID", "App"}},
       false},
      {"a host that needs escaping",
       {{"a", 1}},
       {{"a", 1}, {"HostApplicationDisplayID", "A\"B"}},
       false},
      {"no host", {{"a", 1}}, {{"a", 1}}, false},
  };
  auto store = OpenStore();
  auto livo = NewStoreLivoReporting(store);
  auto analytics = NewStoreAnalytics(store);
  auto session = livo->CreateSession(Dictionary{}, Dictionary{}, Array{});
  WriterGate gate;  // each event and its message land in one batch, the event first
  gate.Close(*store);
  for (const Case& c : cases) {
    analytics->SendEventLazy(
        c.what, [event = c.event] { return Value(event); }, 0);
    session->SendMessage(1, 1, Value(c.message), nullptr);
  }
  gate.Release();
  store->Drain();

  const auto events = ReadRows(db_path_, ReportingSink::kAnalytics);
  const auto refers =
      Query(db_path_, "SELECT message IS NOT NULL FROM store_analytics ORDER BY id");
  ASSERT_EQ(events.size(), std::size(cases));
  ASSERT_EQ(refers.size(), std::size(cases));
  for (std::size_t i = 0; i < std::size(cases); ++i) {
    EXPECT_EQ(events[i].name, cases[i].what);
    EXPECT_EQ(events[i].payload, ToJsonLenient(Value(cases[i].event))) << cases[i].what;
    EXPECT_EQ(refers[i], cases[i].refers ? "1" : "0") << cases[i].what;
  }
}

TEST_F(SchemaTest, AVersion1StoreMigratesInPlaceWithEveryRowReadableAsBefore) {
  MakeVersion1Store(db_path_, 10);
  const Contents before = Contents::Of(db_path_);
  ASSERT_EQ(before.read.size(), 16u);  // 2 sessions, 12 messages, 1 analytics, 1 power-log

  auto store = OpenStore();
  // A client's records during the migration wait for it and then land after the old rows.
  const std::int64_t session = store->NewSessionId();
  EXPECT_EQ(session, 3);
  store->AddSession(session, Value(Dictionary{}), Value(Dictionary{}));
  store->AddPowerLogEvent(28, "new", Value(Dictionary{}));
  store->Drain();
  EXPECT_EQ(log_->Count("schema version 1 to 2: moved 2 sessions, 12 messages, 1 analytics "
                        "events and 1 power-log events"),
            1);
  EXPECT_EQ(log_->Count("vacuumed the file"), 1);
  store->Close();

  EXPECT_EQ(Query(db_path_, "PRAGMA user_version"), std::vector<std::string>{"2"});
  EXPECT_EQ(Query(db_path_, "PRAGMA auto_vacuum"), std::vector<std::string>{"2"});
  Contents after = Contents::Of(db_path_);
  EXPECT_EQ(Query(db_path_, "SELECT id FROM powerlog_events WHERE name = 'new'"),
            std::vector<std::string>{"2"});
  std::erase_if(after.views, [](const std::string& row) {
    return row.starts_with("livo_sessions|3|") || row.starts_with("powerlog_events|2|");
  });
  std::erase_if(after.read, [](const std::string& row) {
    return row.starts_with("livo_sessions|3|") || row.starts_with("powerlog_events|2|");
  });
  EXPECT_EQ(after, before);
}

TEST_F(SchemaTest, ANewerStoreIsRefusedAndLeftUntouched) {
  MakeVersion1Store(db_path_, 1);
  Exec(db_path_, "PRAGMA wal_checkpoint(TRUNCATE); PRAGMA user_version = 3");
  const std::string bytes = testing::ReadFileText(db_path_);
  std::optional<Error> error;
  EXPECT_FALSE(ReportingStore::Open(db_path_, log_, &error));
  ASSERT_TRUE(error);
  EXPECT_NE(error->description.find("schema version 3 is newer than this program's (2)"),
            std::string::npos)
      << error->description;
  EXPECT_EQ(testing::ReadFileText(db_path_), bytes);
}

// SIGKILL while the migration's transaction is open: the file is still version 1 with every
// row (or, had the kill come late, fully migrated), and the next start migrates it.
TEST_F(SchemaTest, AMigrationKilledHalfWayLeavesVersion1) {
  MakeVersion1Store(db_path_, 100'000);
  const Contents before = Contents::Of(db_path_);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    auto store = ReportingStore::Open(db_path_, nullptr, nullptr);
    for (;;) pause();
  }
  // The transaction spills its pages into the WAL long before it commits.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  std::error_code ignored;
  while (std::filesystem::file_size(db_path_ + "-wal", ignored) < (4u << 20) &&
         std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  kill(child, SIGKILL);
  int status = 0;
  waitpid(child, &status, 0);

  const auto version = Query(db_path_, "PRAGMA user_version");
  EXPECT_TRUE(version == std::vector<std::string>{"1"} || version == std::vector<std::string>{"2"});
  EXPECT_EQ(Query(db_path_, "PRAGMA integrity_check"), std::vector<std::string>{"ok"});
  EXPECT_TRUE(Contents::Of(db_path_) == before);
  OpenStore()->Drain();
  EXPECT_EQ(Query(db_path_, "PRAGMA user_version"), std::vector<std::string>{"2"});
  EXPECT_TRUE(Contents::Of(db_path_) == before);
}

}  // namespace
}  // namespace qn
