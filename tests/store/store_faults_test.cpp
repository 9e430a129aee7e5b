// The store's failure path: a record that cannot be written, a database that cannot grow.
#include <gtest/gtest.h>

#include <future>
#include <string>

#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ReadRows;
using Table = ReportingStoreRow::Table;

class StoreFaultsTest : public testing::StoreTest {};

TEST_F(StoreFaultsTest, ARecordThatFailsOnItsOwnIsTheOnlyOneLostFromItsBatch) {
  auto store = OpenStore();
  // The writer waits inside a task until every record below is queued: they are one batch.
  std::promise<void> release;
  std::promise<void> entered;
  store->AfterWrite([&] {
    entered.set_value();
    release.get_future().wait();
  });
  entered.get_future().wait();

  const std::int64_t id = store->NewSessionId();
  store->AddPowerLogEvent(1, "a", Value());
  store->AddSession(id, Value(Dictionary{}), Value(Dictionary{}));
  store->AddSession(id, Value(Dictionary{{"twice", 1}}), Value(Dictionary{}));  // same key
  std::promise<std::optional<Error>> flushed;
  store->MarkSessionFlushed(id, [&](std::optional<Error> e) { flushed.set_value(e); });
  store->AddPowerLogEvent(1, "b", Value());
  release.set_value();
  store->Drain();

  EXPECT_FALSE(flushed.get_future().get());
  const auto sessions = ReadRows(db_path_, ReportingSink::kReporting);
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0].table, Table::kLivoSession);
  EXPECT_TRUE(sessions[0].flushed);
  EXPECT_EQ(sessions[0].session_info, "{}");
  const auto events = ReadRows(db_path_, ReportingSink::kPowerLog);
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].name, "a");
  EXPECT_EQ(events[1].name, "b");
  EXPECT_EQ(store->stats().failed, 1u);
  EXPECT_EQ(log_->Count("dropped a session record that cannot be written"), 1);
  EXPECT_EQ(log_->Count("dropped a batch"), 0);
}

TEST_F(StoreFaultsTest, AFullDatabaseIsLoggedOnceCountedAndWrittenAgainWhenThereIsRoom) {
  auto store = OpenStore();
  store->AddPowerLogEvent(1, "before", Value());
  store->Drain();
  // The database may not grow beyond its size now; each row needs pages of its own.
  store->ExecuteForTesting("PRAGMA max_page_count = 1");
  store->Drain();
  const std::string big(100'000, 'x');
  constexpr int kLost = 5;
  for (int i = 0; i < kLost; ++i) {
    EXPECT_TRUE(store->AddPowerLogEvent(1, "lost", Value(big)));
    store->Drain();  // one batch each
  }
  EXPECT_EQ(log_->Count("database or disk is full"), 1);
  EXPECT_EQ(store->stats().failed, static_cast<std::uint64_t>(kLost));

  store->ExecuteForTesting("PRAGMA max_page_count = 1073741823");
  EXPECT_TRUE(store->AddPowerLogEvent(1, "after", Value(big)));
  store->Drain();
  const auto rows = ReadRows(db_path_, ReportingSink::kPowerLog);
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0].name, "before");
  EXPECT_EQ(rows[1].name, "after");
  EXPECT_EQ(log_->Count("writing again; 5 records were lost meanwhile"), 1);
  EXPECT_EQ(log_->Count("database or disk is full"), 1);
}

}  // namespace
}  // namespace qn
