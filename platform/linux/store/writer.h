#pragma once

#include <sqlite3.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "common/Error.h"
#include "common/HeldBytes.h"
#include "common/Value.h"
#include "platform/linux/reporting_store.h"
#include "platform/linux/store/checkpointer.h"
#include "platform/linux/store/repeats.h"
#include "platform/linux/store/retention.h"
#include "platform/linux/store/sqlite.h"
#include "platform/log.h"

namespace qn {

using store::DbHandle;
using store::Statement;

enum class RecordKind : std::uint8_t {
  kSession,
  kFlush,
  kSessionMessage,
  kSingleMessage,
  kAnalytics,
  kPowerLog,
  kTask,
  kExec,
};

// What the rarer kinds of records carry besides the common fields.
struct RecordExtra {
  std::string name;  // analytics/power-log event name; SQL of kExec
  Value session_info;
  Value user_info;
  std::function<Value()> provider;
  std::function<void(std::optional<Error>)> flushed;
  std::function<void()> task;
};

// One queued record. Kept small: the hot kind (a session message) needs no allocation
// beyond the queue's own storage.
struct Record {
  RecordKind kind = RecordKind::kTask;
  std::uint16_t category = 0;
  std::uint16_t type = 0;
  std::int32_t subsystem = 0;
  std::int64_t id = 0;  // session row id (kSession, kFlush, kSessionMessage)
  bool failed = false;  // set by the writer when the record could not be written
  double time = 0;
  Value payload;
  // The approximate bytes the record holds (its payload's, plus what a provider keeps),
  // counted in backlog_bytes_ and, when `charged`, in that account until written.
  std::size_t bytes = 0;
  std::shared_ptr<HeldBytes> charged;
  std::unique_ptr<RecordExtra> extra;
};

// The writer: owns the connection, the queue and the writer thread. The thread holds a
// reference to it, so it outlives the ReportingStore when the store is closed from the
// writer thread itself.
class ReportingStoreWriter : public std::enable_shared_from_this<ReportingStoreWriter> {
 public:
  ReportingStoreWriter(DbHandle db, std::shared_ptr<Log> log, ReportingStore::Options options,
                       std::int64_t next_session_id);

  ~ReportingStoreWriter();

  // Brings the schema to this program's version (platform/linux/store/schema.h), prepares
  // the statements and starts the checkpointer, once; returns the error otherwise. Called
  // by Open for a new or current file, else by the writer thread before its first batch
  // (and again before each batch while it fails, whose records are then lost).
  std::optional<Error> Ready();

  void Start();

  std::int64_t NewSessionId() { return next_session_id_.fetch_add(1, std::memory_order_relaxed); }

  // Hands `record` to the writer. A control record (flush, task) is taken even when the
  // queue is full. Returns false when the record was not taken; a control record's
  // callback is then the caller's to run.
  // With `new_session_id`, the record (a session row) gets its id from NewSessionId here,
  // in queue order, also when it is not taken; the id is stored there too.
  bool Push(Record&& record, bool control, std::int64_t* new_session_id = nullptr);

  void Drain();

  // Stops taking records; the writer finishes what is queued and closes the database.
  // Waits for that unless called on the writer thread.
  void Shutdown();

  ReportingStore::Stats stats() const;

  std::uint64_t backlog() const { return backlog_.load(std::memory_order_relaxed); }
  std::uint64_t backlog_bytes() const { return backlog_bytes_.load(std::memory_order_relaxed); }

  void SetAfterBatch(std::function<void()> callback);

  bool open() const;

 private:
  // The tables whose rows the writer gives ids (sessions get theirs from NewSessionId).
  enum Table { kSessions, kMessages, kAnalytics, kPowerLog, kTables };
  // The next id of `table`'s sequence, noted as written in this transaction. Ids taken by a
  // transaction that is rolled back are skipped, never reused.
  std::int64_t TakeId(Table table);

  std::optional<Error> Prepare();
  void Run();
  // Lets retention remove a step of rows when a limit is passed; updates its stats.
  void RunRetention();

  // Copies what is left of the WAL into the database, so that the next commit starts the
  // WAL over (the commits wait meanwhile, mostly for the fsyncs). While the checkpointer is
  // at work the writer goes on and looks again at the next batch; only a WAL twice past
  // kWrapPages (a disk slower than the writer) makes it wait for that checkpoint. When a
  // reader still holds old frames, the next batch tries again.
  void FinishCheckpoint();

  void CloseDatabase();

  // Writes `batch` in one transaction; when that fails, once more; when that fails too,
  // record by record, each in a transaction of its own, so that only a record that fails
  // on its own is lost (logged and counted each). A failure of the database as a whole
  // (FailsEveryRecord) loses the rest of the batch at once, as every record would fail the
  // same way; it is logged when the database enters that state (or its error changes), not
  // for every batch, and the next commit logs that writing works again. Marks every lost
  // record `failed`; returns the last error, or nullopt when nothing was lost.
  std::optional<Error> WriteBatch(std::vector<Record>& batch);

  // Why a transaction failed: the step, SQLite's result code and message, as an Error.
  struct Failure {
    int rc;
    std::string message;
    Error error;
  };

  // Writes `records` in one transaction and commits; on failure rolls back.
  std::optional<Failure> WriteTransaction(std::span<Record> records);

  Failure Fail(int rc, const char* step);

  // Marks `records` lost by a failure of the whole database; logs it on a change of state.
  std::optional<Error> LoseAll(std::span<Record> records, const Failure& failure);

  // Binds the JSON text of `value`, written into `buffer`, which must then stay untouched
  // until the statement has run.
  static void BindJson(sqlite3_stmt* stmt, int index, std::string& buffer, const Value& value);

  static void BindText(sqlite3_stmt* stmt, int index, const std::string& text);

  int WriteRecord(Record& r);

  Value CallProvider(const std::function<Value()>& provider, const std::string& name);

  // Calls the flush handlers and tasks of a written batch, in queue order.
  void RunCallbacks(std::vector<Record>& batch, const std::optional<Error>& error);

  void LogQueueFull(std::uint64_t dropped);

  // Writer-thread state: the connection, its statements, the JSON buffers.
  DbHandle db_;
  std::unique_ptr<store::Checkpointer> checkpointer_;  // writer thread (set before it starts)
  bool ready_ = false;  // writer thread once started: Ready succeeded
  int wal_pages_ = 0;   // writer thread: frames in the WAL after the last commit
  Statement begin_, commit_, rollback_;
  Statement insert_session_, flush_session_, set_last_message_, insert_message_, insert_single_;
  Statement insert_analytics_, insert_powerlog_, raise_sequence_, insert_link_;
  // This transaction's references from analytics events to messages (a store_links row).
  struct Link {
    std::int64_t first_message = 0, last_message = 0, first_event = 0, last_event = 0;
    void Add(std::int64_t message, std::int64_t event) {
      if (first_message == 0 || message < first_message) first_message = message;
      last_message = std::max(last_message, message);
      if (first_event == 0) first_event = event;
      last_event = event;
    }
  } link_;
  std::int64_t next_ids_[kTables] = {};     // writer thread: the next id of each table
  std::int64_t written_ids_[kTables] = {};  // writer thread: this transaction's highest
  std::string json_payload_, json_session_info_, json_user_info_;
  std::unique_ptr<store::Retention> retention_;  // set by Prepare
  bool retention_busy_ = false;                  // it has more to remove
  // The newest message row of each session this transaction wrote to.
  std::unordered_map<std::int64_t, std::int64_t> session_last_message_;
  store::RecentMessages recent_messages_;  // for analytics events that repeat a message
  int failing_rc_ = 0;  // the error of the database as a whole while writes fail, else 0
  std::uint64_t lost_while_failing_ = 0;

  const std::shared_ptr<Log> log_;
  const ReportingStore::Options options_;
  std::atomic<std::int64_t> next_session_id_;

  mutable std::mutex mu_;
  std::condition_variable wake_;           // the writer waits for records
  std::condition_variable written_cv_;     // drains wait for batches
  std::vector<Record> queue_;              // GUARDED_BY(mu_)
  bool writer_idle_ = false;               // GUARDED_BY(mu_): the writer waits on wake_
  bool closing_ = false;                   // GUARDED_BY(mu_)
  bool exited_ = false;                    // GUARDED_BY(mu_)
  std::uint64_t written_ = 0;              // GUARDED_BY(mu_): records handed over and written
  std::uint64_t dropped_queue_full_ = 0;   // GUARDED_BY(mu_): not yet logged
  ReportingStore::Stats stats_;            // GUARDED_BY(mu_)
  std::function<void()> after_batch_;      // GUARDED_BY(mu_)
  bool gathering_ = false;                 // GUARDED_BY(mu_): the writer gathers a batch
  int drains_waiting_ = 0;                 // GUARDED_BY(mu_): Drain calls waiting
  std::atomic<std::uint64_t> backlog_{0};  // records handed over and not yet written
  // The approximate bytes of the payloads handed over and not yet written.
  std::atomic<std::uint64_t> backlog_bytes_{0};

  std::mutex thread_mu_;  // serialises join/detach of thread_
  std::thread thread_;
  std::thread::id writer_id_;  // set by Start before the store is published
};

}  // namespace qn
