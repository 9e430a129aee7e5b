#include "platform/linux/reporting_store.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>

#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ParseJson;
using testing::ReadRows;
using Table = ReportingStoreRow::Table;

// Holds the writer thread inside a task until Release, so that a test can hand records
// over while the writer is known to be busy, and knows what lands in the next batch.
class WriterGate {
 public:
  // Queues the blocking task; returns once the writer is inside it.
  void Close(ReportingStore& store) {
    store.AfterWrite([this] {
      std::unique_lock lock(mu_);
      writer_thread_ = std::this_thread::get_id();
      entered_ = true;
      cv_.notify_all();
      cv_.wait(lock, [this] { return open_; });
    });
    std::unique_lock lock(mu_);
    cv_.wait(lock, [this] { return entered_; });
  }
  void Release() {
    std::lock_guard lock(mu_);
    open_ = true;
    cv_.notify_all();
  }
  std::thread::id writer_thread() const {
    std::lock_guard lock(mu_);
    return writer_thread_;
  }

 private:
  mutable std::mutex mu_;
  std::condition_variable cv_;
  bool entered_ = false;
  bool open_ = false;
  std::thread::id writer_thread_;
};

using ReportingStoreTest = testing::StoreTest;

// The database may not grow: a batch that needs a new page fails (its flush gets the
// error), the state is logged once however many batches fail, and writing resumes when
// there is room, with one line saying how much was lost meanwhile.
TEST_F(ReportingStoreTest, AFullDatabaseIsLoggedOnceCountedAndWrittenAgainWhenThereIsRoom) {
  auto store = OpenStore();
  store->AddPowerLogEvent(1, "before", Value());
  store->Drain();
  WriterGate gate;  // the limit, the rows and the flush are one batch
  gate.Close(*store);
  store->ExecuteForTesting("PRAGMA max_page_count = 1");
  const std::string big(100'000, 'x');
  for (int i = 0; i < 3; ++i) store->AddPowerLogEvent(1, "lost", Value(big));
  std::promise<std::optional<Error>> flush_result;
  store->MarkSessionFlushed(1, [&](std::optional<Error> e) { flush_result.set_value(e); });
  gate.Release();
  store->Drain();
  auto flush_error = flush_result.get_future().get();
  ASSERT_TRUE(flush_error);
  EXPECT_EQ(flush_error->code, SQLITE_FULL);
  for (int i = 0; i < 2; ++i) {
    EXPECT_TRUE(store->AddPowerLogEvent(1, "lost", Value(big)));
    store->Drain();  // one batch each
  }
  auto errors = log_->Matching("database or disk is full");
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_EQ(log_->Lines()[0].level, LogLevel::kError);
  EXPECT_EQ(store->stats().failed, 7u);  // the batch: the limit, three rows, the flush

  store->ExecuteForTesting("PRAGMA max_page_count = 1073741823");
  EXPECT_TRUE(store->AddPowerLogEvent(1, "after", Value(big)));
  store->Drain();
  const auto rows = ReadRows(db_path_, ReportingSink::kPowerLog);
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0].name, "before");
  EXPECT_EQ(rows[1].name, "after");
  EXPECT_EQ(log_->Count("writing again; 7 records were lost meanwhile"), 1);
  EXPECT_EQ(log_->Count("database or disk is full"), 1);
}

TEST_F(ReportingStoreTest, ARecordThatFailsOnItsOwnIsTheOnlyOneLostFromItsBatch) {
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

TEST_F(ReportingStoreTest, LockedDatabaseDropsTheBatchUntilReleased) {
  ReportingStore::Options options;
  options.busy_timeout_ms = 50;
  auto store = OpenStore(options);

  // Another connection (as another process would) holds the write lock.
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(db_path_.c_str(), &other), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);
  EXPECT_TRUE(store->AddPowerLogEvent(1, "lost", Value()));
  store->Drain();  // returns: the writer gave up on the lock
  auto errors = log_->Matching("dropped a batch of 1 records");
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_NE(errors[0].find("database is locked"), std::string::npos) << errors[0];

  ASSERT_EQ(sqlite3_exec(other, "COMMIT", nullptr, nullptr, nullptr), SQLITE_OK);
  sqlite3_close(other);
  EXPECT_TRUE(store->AddPowerLogEvent(1, "kept", Value()));
  store->Drain();
  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0].name, "kept");
  EXPECT_EQ(store->stats().failed, 1u);
}

TEST_F(ReportingStoreTest, FullQueueDropsCountsAndLogsWithoutBlocking) {
  ReportingStore::Options options;
  options.max_queued_records = 10;
  auto store = OpenStore(options);
  WriterGate gate;
  gate.Close(*store);

  int taken = 0;
  for (int i = 0; i < 25; ++i) taken += store->AddSessionMessage(1, 1, 1, Value(i)) ? 1 : 0;
  EXPECT_EQ(taken, 10);
  // Flushes and tasks are never dropped for a full queue.
  std::promise<std::optional<Error>> flushed;
  store->MarkSessionFlushed(1, [&](std::optional<Error> e) { flushed.set_value(e); });

  gate.Release();
  store->Drain();
  EXPECT_FALSE(flushed.get_future().get());
  EXPECT_EQ(store->stats().dropped_queue_full, 15u);
  EXPECT_EQ(log_->Count("dropped 15 records"), 1);
  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 10u);
  EXPECT_EQ(rows.back().payload, "9");
}

TEST_F(ReportingStoreTest, AfterCloseRecordsAreRefusedCallbacksStillRun) {
  auto store = OpenStore();
  store->AddPowerLogEvent(1, "kept", Value());
  store->Close();
  EXPECT_FALSE(store->AddPowerLogEvent(1, "refused", Value()));
  store->Drain();  // returns at once

  std::promise<std::optional<Error>> flushed;
  std::thread::id handler_thread;
  store->MarkSessionFlushed(1, [&](std::optional<Error> e) {
    handler_thread = std::this_thread::get_id();
    flushed.set_value(e);
  });
  EXPECT_TRUE(flushed.get_future().get());
  EXPECT_NE(handler_thread, std::this_thread::get_id());

  std::promise<void> ran;
  store->AfterWrite([&] { ran.set_value(); });
  ran.get_future().get();

  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0].name, "kept");
}

TEST_F(ReportingStoreTest, OpenRefusesNewerSchemasAndNonDatabases) {
  {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(db_path_.c_str(), &db), SQLITE_OK);
    sqlite3_exec(db, "PRAGMA user_version = 99", nullptr, nullptr, nullptr);
    sqlite3_close(db);
  }
  std::optional<Error> error;
  EXPECT_FALSE(ReportingStore::Open(db_path_, log_, &error));
  ASSERT_TRUE(error);
  EXPECT_NE(error->description.find("schema version 99"), std::string::npos);

  const std::string junk = dir_.File("junk.db");
  FILE* f = fopen(junk.c_str(), "w");
  ASSERT_TRUE(f);
  fputs("this is not a database, not even close to one, but long enough to look", f);
  fclose(f);
  error.reset();
  EXPECT_FALSE(ReportingStore::Open(junk, log_, &error));
  EXPECT_TRUE(error);

  error.reset();
  EXPECT_FALSE(ReportingStore::Open(dir_.File("no/such/dir/reports.db"), log_, &error));
  EXPECT_TRUE(error);
}

}  // namespace
}  // namespace qn
