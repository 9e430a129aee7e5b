// Retention: the file shrinks on disk below its byte limit, the oldest rows go first, rows
// no exporter has shipped go last, the age limit removes shipped rows only, and a session
// row stays while its messages do.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/store/retention.h"
#include "platform/linux/store_sinks.h"
#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ReadRows;

std::vector<std::int64_t> Ids(const std::string& db, ReportingStoreRow::Table table) {
  std::vector<std::int64_t> ids;
  for (const auto& row : ReadRows(db)) {
    if (row.table == table) ids.push_back(row.id);
  }
  return ids;
}

void Exec(const std::string& db_path, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(db_path.c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sql;
  sqlite3_close(db);
}

// Whether `ids` are the newest `ids.size()` of 1..last: what oldest-first leaves.
bool NewestOf(const std::vector<std::int64_t>& ids, std::int64_t last) {
  for (std::size_t i = 0; i < ids.size(); ++i) {
    if (ids[i] != last - static_cast<std::int64_t>(ids.size() - 1 - i)) return false;
  }
  return true;
}

class RetentionTest : public testing::StoreTest {
 protected:
  std::shared_ptr<ReportingStore> OpenWithLimits(std::uint64_t max_bytes, double max_age = 0) {
    ReportingStore::Options options;
    options.max_bytes = max_bytes;
    options.max_age_seconds = max_age;
    return OpenStore(options);
  }
  // Waits (bounded) until `done` holds for the store's stats.
  static bool WaitFor(ReportingStore& store,
                      const std::function<bool(const ReportingStore::Stats&)>& done) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (!done(store.stats())) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
  }
  const Value big_ = Value(std::string(400, 'x'));
};

TEST_F(RetentionTest, TheFileShrinksOldestFirstAndUnshippedRowsGoLast) {
  constexpr std::uint64_t kMiB = 1 << 20;
  {
    auto store = OpenWithLimits(0);
    const std::int64_t session = store->NewSessionId();
    store->AddSession(session, Value(Dictionary{}), Value(Dictionary{}));
    // The oldest rows are power-log events that an exporter has not shipped.
    for (int i = 0; i < 5000; ++i) store->AddPowerLogEvent(28, "p", big_);
    for (int i = 0; i < 10000; ++i) store->AddSessionMessage(session, 1, 1, big_);
    store->Drain();
  }
  Exec(db_path_, "INSERT INTO export_cursors VALUES('nats', 'powerlog', 0)");
  const auto size_before = std::filesystem::file_size(db_path_);
  ASSERT_GT(size_before, 5 * kMiB);

  // 3 MiB: the messages go, oldest first; every power-log row stays.
  {
    auto store = OpenWithLimits(3 * kMiB);
    ASSERT_TRUE(WaitFor(
        *store, [](auto& s) { return s.bytes_on_disk > 0 && s.bytes_on_disk <= 3 * kMiB; }));
    EXPECT_EQ(store->stats().retention_lost, 0u);
  }
  EXPECT_LE(std::filesystem::file_size(db_path_), 3 * kMiB);
  EXPECT_TRUE(log_->Matching("fail").empty());  // closing included
  EXPECT_EQ(Ids(db_path_, ReportingStoreRow::Table::kPowerLogEvent).size(), 5000u);
  const auto messages = Ids(db_path_, ReportingStoreRow::Table::kLivoMessage);
  EXPECT_TRUE(!messages.empty() && messages.size() < 10000 && NewestOf(messages, 10000));
  EXPECT_EQ(Ids(db_path_, ReportingStoreRow::Table::kLivoSession).size(), 1u);

  // 1 MiB: nothing shipped is left, so unshipped rows go too, oldest first, counted as lost.
  {
    auto store = OpenWithLimits(kMiB);
    ASSERT_TRUE(
        WaitFor(*store, [](auto& s) { return s.bytes_on_disk > 0 && s.bytes_on_disk <= kMiB; }));
    const auto power = Ids(db_path_, ReportingStoreRow::Table::kPowerLogEvent);
    EXPECT_TRUE(power.size() < 5000 && NewestOf(power, 5000));
    EXPECT_EQ(store->stats().retention_lost, 5000 - power.size());
    EXPECT_EQ(log_->Count("rows that no exporter had shipped yet"), 1);
  }
  EXPECT_TRUE(Ids(db_path_, ReportingStoreRow::Table::kLivoMessage).empty());
  EXPECT_TRUE(Ids(db_path_, ReportingStoreRow::Table::kLivoSession).empty());
  EXPECT_LE(std::filesystem::file_size(db_path_), kMiB);
  EXPECT_EQ(log_->Count("removing the oldest rows, past the size limit"), 2);

  // Ids go on where they were, also in the tables retention emptied.
  auto store = OpenWithLimits(0);
  EXPECT_EQ(store->NewSessionId(), 2);
  store->AddSessionMessage(1, 1, 1, Value(1));
  store->Drain();
  EXPECT_EQ(Ids(db_path_, ReportingStoreRow::Table::kLivoMessage),
            std::vector<std::int64_t>{10'001});
}

TEST_F(RetentionTest, TheAgeLimitRemovesShippedRowsAndKeepsSessionsWithMessages) {
  {
    auto store = OpenWithLimits(0);
    const std::int64_t session = store->NewSessionId();
    store->AddSession(session, Value(Dictionary{}), Value(Dictionary{}));
    for (int i = 0; i < 10; ++i) store->AddPowerLogEvent(28, "p", Value(i));
    store->AddSessionMessage(session, 1, 1, Value(Dictionary{}));
    store->Drain();
  }
  // A day old: the session and the power-log rows; up to row 6 shipped.
  Exec(db_path_,
       "UPDATE store_sessions SET created = created - 86400;"
       "UPDATE store_powerlog SET time = time - 86400;"
       "INSERT INTO export_cursors VALUES('a', 'powerlog', 6), ('b', 'powerlog', 9)");
  auto store = OpenWithLimits(0, 3600);
  ASSERT_TRUE(WaitFor(*store, [](auto& s) { return s.retention_removed == 6; }));
  EXPECT_EQ(Ids(db_path_, ReportingStoreRow::Table::kPowerLogEvent),
            (std::vector<std::int64_t>{7, 8, 9, 10}));
  EXPECT_EQ(Ids(db_path_, ReportingStoreRow::Table::kLivoSession).size(), 1u);
  EXPECT_EQ(store->stats().retention_lost, 0u);
  const auto oldest = store->stats().oldest_row_time;
  ASSERT_TRUE(oldest);
  EXPECT_GT(
      std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count() -
          *oldest,
      86000);
}

// An analytics event that refers to a message goes with it; what is left reads back whole.
TEST_F(RetentionTest, EventsThatReferToAMessageGoWithIt) {
  {
    auto store = OpenWithLimits(0);
    auto analytics = NewStoreAnalytics(store);
    const std::int64_t session = store->NewSessionId();
    store->AddSession(session, Value(Dictionary{}), Value(Dictionary{}));
    testing::WriterGate gate;  // one transaction: every event finds its message
    gate.Close(*store);
    for (int i = 0; i < 2000; ++i) {
      const Dictionary message{{"n", i}};
      Dictionary event = message;
      event.Set("HostApplicationDisplayID", "App");
      analytics->SendEventLazy(
          "e", [event] { return Value(event); }, 0);
      store->AddSessionMessage(session, 1, 1, Value(message));
    }
    gate.Release();
    store->Drain();
  }
  // A day old and shipped: events 1 to 1200. They go; their messages stay.
  Exec(db_path_,
       "UPDATE store_analytics SET time = time - 86400 WHERE id <= 1200;"
       "INSERT INTO export_cursors VALUES('x', 'analytics', 1500)");
  {
    auto store = OpenWithLimits(0, 3600);
    ASSERT_TRUE(WaitFor(*store, [](auto& s) { return s.retention_removed >= 1200; }));
  }
  EXPECT_EQ(Ids(db_path_, ReportingStoreRow::Table::kLivoMessage).size(), 2000u);
  auto events = ReadRows(db_path_, ReportingSink::kAnalytics);
  ASSERT_EQ(events.size(), 800u);
  EXPECT_EQ(events.front().payload, R"({"n":1200,"HostApplicationDisplayID":"App"})");

  // Now the messages are a day old and every event is shipped: the messages go, and the
  // (recent) events that refer to them with them.
  Exec(db_path_,
       "UPDATE store_messages SET time = time - 86400;"
       "UPDATE export_cursors SET last_id = 2000");
  auto store = OpenWithLimits(0, 3600);
  ASSERT_TRUE(WaitFor(*store, [](auto& s) { return s.retention_removed >= 2800; }));
  EXPECT_TRUE(Ids(db_path_, ReportingStoreRow::Table::kLivoMessage).empty());
  EXPECT_TRUE(ReadRows(db_path_, ReportingSink::kAnalytics).empty());
  EXPECT_EQ(store->stats().retention_lost, 0u);
}

TEST(RetentionLimitsTest, SizesAndDurationsParse) {
  const std::pair<const char*, std::optional<std::uint64_t>> sizes[] = {
      {"512", 512},
      {"64K", 64 << 10},
      {"64M", 64 << 20},
      {"4G", 4ull << 30},
      {"1TiB", 1ull << 40},
      {"10MB", 10 << 20},
      {"", std::nullopt},
      {"M", std::nullopt},
      {"5X", std::nullopt},
      {"-1", std::nullopt},
      {"99999999999999999999", std::nullopt},
      {"20000000T", std::nullopt}};
  for (const auto& [text, bytes] : sizes) EXPECT_EQ(store::ParseByteSize(text), bytes) << text;
  const std::pair<const char*, std::optional<double>> durations[] = {{"90", 90},
                                                                     {"90s", 90},
                                                                     {"15min", 900},
                                                                     {"12h", 43200},
                                                                     {"30d", 2592000},
                                                                     {"1d 12h", 129600},
                                                                     {"2w", 1209600},
                                                                     {"", std::nullopt},
                                                                     {"h", std::nullopt},
                                                                     {"3 years", std::nullopt},
                                                                     {"1.5h", std::nullopt}};
  for (const auto& [text, seconds] : durations) {
    EXPECT_EQ(store::ParseDuration(text), seconds) << text;
  }
}

}  // namespace
}  // namespace qn
