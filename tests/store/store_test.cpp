// The SQLite store with fault injection (disk full, a record that cannot be written, a
// database locked by another process, a full queue, a closed store, a newer schema), and
// its sinks, run through the same contract as their fakes.
#include "platform/linux/reporting_store.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <atomic>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <thread>
#include <tuple>

#include "common/Json.h"
#include "platform/linux/store_sinks.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ReadRows;
using Table = ReportingStoreRow::Table;

using testing::WriterGate;
using ReportingStoreTest = testing::StoreTest;

// The database may not grow: a batch that needs a new page fails (its flush gets the
// error), the state is logged once however many batches fail, and writing resumes when
// there is room, with one line saying how much was lost meanwhile.
TEST_F(ReportingStoreTest, AFullDatabaseIsLoggedOnceAndWrittenAgainWhenThereIsRoom) {
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
  for (const auto& line : log_->Lines()) {
    if (line.text.find("database or disk is full") != std::string::npos) {
      EXPECT_EQ(line.level, LogLevel::kError);
    }
  }
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
  WriterGate gate;  // every record below is one batch
  gate.Close(*store);
  const std::int64_t id = store->NewSessionId();
  store->AddPowerLogEvent(1, "a", Value());
  store->AddSession(id, Value(Dictionary{}), Value(Dictionary{}));
  store->AddSession(id, Value(Dictionary{{"twice", 1}}), Value(Dictionary{}));  // same key
  std::promise<std::optional<Error>> flushed;
  store->MarkSessionFlushed(id, [&](std::optional<Error> e) { flushed.set_value(e); });
  store->AddPowerLogEvent(1, "b", Value());
  gate.Release();
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

// The checkpointer copies the WAL into the database while the writer goes on (before the
// writer would wrap the WAL itself), and a long burst does not grow the WAL past twice the
// 64 MiB it is cut back to (the writer wraps it when the checkpointer is idle, and at the
// latest there).
TEST_F(ReportingStoreTest, TheWalIsCopiedBesideTheWriterAndStaysBounded) {
  auto store = OpenStore();
  const std::string big(128 * 1024, 'x');
  auto burst = [&](int mebibytes) {
    for (int batch = 0; batch < mebibytes; ++batch) {
      for (int i = 0; i < 8; ++i) store->AddPowerLogEvent(1, "burst", Value(big));
      store->Drain();
    }
  };
  burst(24);  // 1,536 pages: a checkpoint is due, a wrap is not
  for (int i = 0; i < 1000 && std::filesystem::file_size(db_path_) < (8u << 20); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_GE(std::filesystem::file_size(db_path_), 8u << 20);
  burst(232);
  EXPECT_LT(std::filesystem::file_size(db_path_ + "-wal"), 140u << 20);
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
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(db_path_.c_str(), &db), SQLITE_OK);
  sqlite3_exec(db, "PRAGMA user_version = 99", nullptr, nullptr, nullptr);
  sqlite3_close(db);
  std::ofstream(dir_.File("junk.db")) << "this is not a database, not even close to one, but long";
  for (const std::string& path : {db_path_, dir_.File("junk.db"), dir_.File("no/dir/reports.db")}) {
    std::optional<Error> error;
    EXPECT_FALSE(ReportingStore::Open(path, log_, &error)) << path;
    const std::string text = error.value_or(Error{}).description;
    EXPECT_TRUE(error && (path != db_path_ || text.find("schema version 99") != std::string::npos))
        << path << ": " << text;
  }
}

// ---- Analytics and power log: one contract, run on the store sinks and on the fakes ----

// What an event sink recorded: subsystem (0 for analytics), name, payload JSON.
using RecordedEvent = std::tuple<std::int64_t, std::string, std::string>;

struct StoreSinks {
  testing::TempDir dir;
  std::shared_ptr<ReportingStore> store =
      ReportingStore::Open(dir.File("reports.db"), nullptr, nullptr);
  std::shared_ptr<qn::Analytics> analytics = NewStoreAnalytics(store);
  std::shared_ptr<qn::Enerdex> enerdex = NewStoreEnerdex(store);

  std::vector<RecordedEvent> Recorded(ReportingSink sink) {
    store->Drain();
    std::vector<RecordedEvent> events;
    for (const auto& row : ReadRows(store->path(), sink)) {
      events.emplace_back(row.subsystem, row.name, row.payload);
    }
    return events;
  }
};

struct FakeSinks {
  std::shared_ptr<testing::FakeAnalytics> analytics = std::make_shared<testing::FakeAnalytics>();
  std::shared_ptr<testing::FakeEnerdex> enerdex = std::make_shared<testing::FakeEnerdex>();

  std::vector<RecordedEvent> Recorded(ReportingSink sink) {
    std::vector<RecordedEvent> events;
    for (const auto& e : analytics->Events()) {
      if (sink == ReportingSink::kAnalytics)
        events.emplace_back(0, e.name, ToJsonLenient(e.payload));
    }
    for (const auto& e : enerdex->Events()) {
      if (sink == ReportingSink::kPowerLog)
        events.emplace_back(e.subsystem, e.name, ToJsonLenient(e.payload));
    }
    return events;
  }
};

template <typename Sinks>
class EventSinkContractTest : public ::testing::Test {
 protected:
  Sinks sinks_;
};

using SinkKinds = ::testing::Types<StoreSinks, FakeSinks>;
TYPED_TEST_SUITE(EventSinkContractTest, SinkKinds);

// Each sink records its own events in order: analytics with its provider's payload (called
// once), the power log with subsystem, name and payload.
TYPED_TEST(EventSinkContractTest, EachSinkRecordsItsEventsInOrder) {
  std::atomic<int> calls{0};
  {
    // The payload lives only in the provider, as the analytics bridge hands it over.
    Value payload(Dictionary{{"HostApplicationDisplayID", "Unknown"}, {"volume", 0.5}});
    this->sinks_.analytics->SendEventLazy(
        "com.norvel.quenta.Volume.Stop",
        [payload, &calls] {
          ++calls;
          return payload;
        },
        0);
  }
  this->sinks_.analytics->SendEventLazy("empty", nullptr, 0);
  this->sinks_.enerdex->LogRegisteredEvent(
      28, "Vistrel_Haptics",
      Value(Dictionary{{"EngineOnDuration", 1.5}, {"ApplicationName", "Unknown"}}), Value());
  this->sinks_.enerdex->LogRegisteredEvent(
      28, "LeakedHapticsSessionInfo", Value(Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 3}}),
      Value());
  EXPECT_EQ(this->sinks_.Recorded(ReportingSink::kAnalytics),
            (std::vector<RecordedEvent>{{0, "com.norvel.quenta.Volume.Stop",
                                         R"({"HostApplicationDisplayID":"Unknown","volume":0.5})"},
                                        {0, "empty", "null"}}));
  EXPECT_EQ(calls.load(), 1);
  EXPECT_EQ(this->sinks_.Recorded(ReportingSink::kPowerLog),
            (std::vector<RecordedEvent>{
                {28, "Vistrel_Haptics", R"({"EngineOnDuration":1.5,"ApplicationName":"Unknown"})"},
                {28, "LeakedHapticsSessionInfo", R"({"Haptic_Active_Hardware_Time_Seconds":3})"}}));
}

// ---- The store's sinks alone ----

class StoreSinksTest : public testing::StoreTest {
 protected:
  std::shared_ptr<ReportingStore> store_ = OpenStore();
};

// Analytics providers run on the writer, not the caller's thread. Discovery answers at once
// while the store is open, however far behind its writer is (a session start must not wait
// for the disk).
TEST_F(StoreSinksTest, ProvidersRunOnTheWriterAndDiscoveryAnswersAtOnce) {
  std::thread::id provider_thread;
  NewStoreAnalytics(store_)->SendEventLazy(
      "e",
      [&] {
        provider_thread = std::this_thread::get_id();
        return Value();
      },
      0);
  store_->Drain();
  EXPECT_NE(provider_thread, std::thread::id());
  EXPECT_NE(provider_thread, std::this_thread::get_id());
  auto session = NewStoreLivoReporting(store_, StoreLivoReportingOptions{std::nullopt})
                     ->CreateSession(Dictionary{}, Dictionary{}, Array{});
  bool answered = false;
  session->StartConfiguration([&](std::optional<Array> found) { answered = !found; });
  EXPECT_TRUE(answered);
}

TEST_F(StoreSinksTest, LivoReportingSingleMessagesCarryTheirOwnSessionAndUserInfo) {
  auto livo = NewStoreLivoReporting(store_);
  Dictionary session_info{{kLivoReportingSessionInfoClientType, 19},
                          {kLivoReportingSessionInfoClientVersion, 2.0},
                          {kLivoReportingSessionInfoSessionID, -1}};
  Dictionary user_info{{kLivoReportingUserInfoClientName, "com.norvel.quenta"},
                       {kLivoReportingUserInfoServiceName, "standalone"}};
  std::optional<Error> error;
  EXPECT_TRUE(livo->SendOneMessage(session_info, user_info, 5, 3,
                                   Value(Dictionary{{"some_key", 1}}), &error));
  EXPECT_FALSE(error);
  store_->Drain();
  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0].table, Table::kLivoMessage);
  EXPECT_FALSE(rows[0].session);
  EXPECT_EQ(rows[0].category, 5);
  EXPECT_EQ(rows[0].type, 3);
  EXPECT_EQ(rows[0].payload, R"({"some_key":1})");
  EXPECT_EQ(rows[0].session_info, R"({"ClientType":19,"ClientVersion":2.0,"SessionID":-1})");
  EXPECT_EQ(rows[0].user_info, R"({"ClientName":"com.norvel.quenta","ServiceName":"standalone"})");
}

TEST_F(StoreSinksTest, AClosedStoreRefusesMessagesAndStillAnswers) {
  auto livo = NewStoreLivoReporting(store_);
  auto session = livo->CreateSession(Dictionary{}, Dictionary{}, Array{});
  store_->Close();

  std::optional<Error> error;
  EXPECT_FALSE(session->SendMessage(1, 1, Value(Dictionary{}), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, kReportingStoreErrorDomain);
  error.reset();
  EXPECT_FALSE(livo->SendOneMessage(Dictionary{}, Dictionary{}, 1, 1, Value(), &error));
  EXPECT_TRUE(error);
  EXPECT_FALSE(session->SendMessage(1, 1, Value(), nullptr));  // no error slot: no crash

  std::promise<std::optional<Error>> flushed;
  session->FlushMessages([&](std::optional<Error> e) { flushed.set_value(e); });
  EXPECT_TRUE(flushed.get_future().get());

  // Discovery still answers, from another thread.
  std::promise<std::pair<bool, std::thread::id>> answered;
  session->StartConfiguration([&](std::optional<Array> found) {
    answered.set_value({found.has_value(), std::this_thread::get_id()});
  });
  const auto [found, thread] = answered.get_future().get();
  EXPECT_TRUE(found);
  EXPECT_NE(thread, std::this_thread::get_id());

  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 1u);  // the session row handed over before the close
}

}  // namespace
}  // namespace qn
