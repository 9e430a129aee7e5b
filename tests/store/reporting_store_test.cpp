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

TEST_F(ReportingStoreTest, EveryKindOfRecordLandsInHandOverOrder) {
  auto store = OpenStore();
  const std::int64_t session = store->NewSessionId();
  EXPECT_TRUE(store->AddSession(session, Value(Dictionary{{"ClientType", 19}}),
                                Value(Dictionary{{"ClientName", "com.norvel.quenta"}})));
  EXPECT_TRUE(store->AddSessionMessage(session, 5, 2, Value(Dictionary{{"a", 1}})));
  EXPECT_TRUE(store->AddSessionMessage(session, 0xFFFF, 0xFFFF, Value(Dictionary{{"b", 2}})));
  std::promise<std::optional<Error>> flushed;
  store->MarkSessionFlushed(session, [&](std::optional<Error> e) { flushed.set_value(e); });
  EXPECT_TRUE(store->AddSingleMessage(Value(Dictionary{{"SessionID", -1}}),
                                      Value(Dictionary{{"ServiceName", "standalone"}}), 7, 1,
                                      Value(Dictionary{{"c", 3}})));
  EXPECT_TRUE(store->AddAnalyticsEvent("com.norvel.quenta.Volume.Stop", [] {
    return Value(Dictionary{{"d", 4}});
  }));
  EXPECT_TRUE(store->AddPowerLogEvent(28, "Vistrel_Haptics", Value(Dictionary{{"e", 5}})));
  store->Drain();
  EXPECT_FALSE(flushed.get_future().get());

  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 6u);
  EXPECT_EQ(rows[0].table, Table::kLivoSession);
  EXPECT_EQ(rows[0].id, session);
  EXPECT_EQ(ParseJson(rows[0].session_info), (nlohmann::json{{"ClientType", 19}}));
  EXPECT_EQ(ParseJson(rows[0].user_info), (nlohmann::json{{"ClientName", "com.norvel.quenta"}}));
  ASSERT_TRUE(rows[0].flushed);
  EXPECT_GE(*rows[0].flushed, rows[0].time);

  EXPECT_EQ(rows[1].table, Table::kLivoMessage);
  EXPECT_EQ(rows[1].session, session);
  EXPECT_EQ(rows[1].category, 5);
  EXPECT_EQ(rows[1].type, 2);
  EXPECT_EQ(rows[1].payload, R"({"a":1})");
  EXPECT_EQ(rows[1].session_info, "");
  EXPECT_EQ(rows[2].category, 0xFFFF);
  EXPECT_EQ(rows[2].type, 0xFFFF);
  EXPECT_LT(rows[1].id, rows[2].id);

  EXPECT_EQ(rows[3].table, Table::kLivoMessage);
  EXPECT_FALSE(rows[3].session);
  EXPECT_EQ(rows[3].payload, R"({"c":3})");
  EXPECT_EQ(rows[3].session_info, R"({"SessionID":-1})");
  EXPECT_EQ(rows[3].user_info, R"({"ServiceName":"standalone"})");

  EXPECT_EQ(rows[4].table, Table::kAnalyticsEvent);
  EXPECT_EQ(rows[4].name, "com.norvel.quenta.Volume.Stop");
  EXPECT_EQ(rows[4].payload, R"({"d":4})");

  EXPECT_EQ(rows[5].table, Table::kPowerLogEvent);
  EXPECT_EQ(rows[5].subsystem, 28);
  EXPECT_EQ(rows[5].name, "Vistrel_Haptics");
  EXPECT_EQ(rows[5].payload, R"({"e":5})");

  for (std::size_t i = 1; i < rows.size(); ++i) EXPECT_LE(rows[i - 1].time, rows[i].time);
  EXPECT_EQ(store->stats().committed, 7u);  // six rows and the flush
  EXPECT_EQ(log_->Lines().size(), 0u);
}

TEST_F(ReportingStoreTest, SessionIdsContinueAboveThoseAlreadyStored) {
  std::int64_t last = 0;
  {
    auto store = OpenStore();
    EXPECT_EQ(store->NewSessionId(), 1);
    for (int i = 0; i < 3; ++i) {
      last = store->NewSessionId();
      store->AddSession(last, Value(Dictionary{}), Value(Dictionary{}));
    }
    // An id that was allocated but whose row was never written is not reserved.
    (void)store->NewSessionId();
  }
  auto store = OpenStore();
  EXPECT_EQ(store->NewSessionId(), last + 1);
}

TEST_F(ReportingStoreTest, AnalyticsProviderRunsOnceOnTheWriterWhenTheRowIsWritten) {
  auto store = OpenStore();
  WriterGate gate;
  gate.Close(*store);

  std::atomic<int> calls{0};
  std::thread::id provider_thread;
  store->AddAnalyticsEvent("event", [&] {
    ++calls;
    provider_thread = std::this_thread::get_id();
    return Value(Dictionary{{"n", 1}});
  });
  store->AddAnalyticsEvent("no provider", nullptr);
  EXPECT_EQ(calls.load(), 0);  // handed over, not yet written

  gate.Release();
  store->Drain();
  EXPECT_EQ(calls.load(), 1);
  EXPECT_EQ(provider_thread, gate.writer_thread());
  EXPECT_NE(provider_thread, std::this_thread::get_id());

  auto rows = ReadRows(db_path_, ReportingSink::kAnalytics);
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0].payload, R"({"n":1})");
  EXPECT_EQ(rows[1].payload, "null");
}

TEST_F(ReportingStoreTest, FlushHandlerRunsAfterTheFlushIsCommitted) {
  auto store = OpenStore();
  const std::int64_t id = store->NewSessionId();
  store->AddSession(id, Value(Dictionary{}), Value(Dictionary{}));
  std::promise<std::optional<double>> seen;
  std::thread::id handler_thread;
  store->MarkSessionFlushed(id, [&](std::optional<Error> error) {
    EXPECT_FALSE(error);
    handler_thread = std::this_thread::get_id();
    // Another connection already sees the flushed time.
    auto rows = ReadRows(db_path_, ReportingSink::kReporting);
    seen.set_value(rows.empty() ? std::nullopt : rows[0].flushed);
  });
  EXPECT_TRUE(seen.get_future().get());
  store->Drain();
  EXPECT_NE(handler_thread, std::this_thread::get_id());
}

TEST_F(ReportingStoreTest, DrainOnTheWriterThreadReturnsAndDrainHookOutlivesTheStore) {
  auto store = OpenStore();
  std::promise<void> done;
  store->AfterWrite([&] {
    store->AddPowerLogEvent(1, "queued from the writer", Value());
    store->Drain();  // would wait for itself forever
    done.set_value();
  });
  done.get_future().get();
  auto hook = store->DrainHook();
  hook();
  EXPECT_EQ(ReadRows(db_path_).size(), 1u);
  store.reset();
  hook();  // the store is gone: nothing to do, nothing to crash
}

TEST_F(ReportingStoreTest, DatabaseLockedByAnotherProcessDropsTheBatchUntilReleased) {
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

TEST_F(ReportingStoreTest, AfterCloseRecordsAreRefusedAndCallbacksStillRunElsewhere) {
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

TEST_F(ReportingStoreTest, LastReferenceDroppedOnTheWriterThreadClosesWithoutDeadlock) {
  auto store = OpenStore();
  auto hook = store->DrainHook();
  std::promise<void> ran;
  store->AfterWrite([keep = store, &ran] { ran.set_value(); });
  for (int i = 0; i < 100; ++i) store->AddPowerLogEvent(1, "queued", Value(i));
  store.reset();  // the task's capture is now the last reference
  ran.get_future().get();
  hook();  // waits for the writer to finish what was queued, if it still runs
  EXPECT_EQ(ReadRows(db_path_).size(), 100u);
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
