#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "common/Error.h"
#include "common/Value.h"
#include "platform/log.h"

namespace qn {

class ReportingStoreWriter;

// The embedded reporting store: an SQLite database (WAL journal) that keeps what the
// framework sinks are handed (framework sessions and their messages, single messages,
// analytics events, power-log events). What readers see is documented in
// reporting_store_reader.h; the layout behind it, its versions and their migration in
// platform/linux/store/schema.h. An older file is migrated by the writer thread before
// its first batch (records queue meanwhile); a newer one makes Open fail.
//
// Retention: past Options::max_bytes or Options::max_age_seconds the writer removes the
// oldest rows between its transactions, in small steps, and the file shrinks (see
// platform/linux/store/retention.h for what it keeps; Stats has its figures).
//
// Threads: one writer thread of the store owns the database connection. Every Add* call
// only hands a record over through an in-memory queue and returns at once; it never
// waits for a disk. The writer takes everything queued, writes it in one transaction with
// prepared statements and commits. While records keep coming it first gathers them for up
// to 2 ms (or 512 records), as a commit costs about as much for a few records as for
// hundreds; nobody waiting in Drain is ever kept waiting for that. What a row holds is
// fixed at hand-over (values are immutable); only an analytics payload is produced later,
// by its provider, when the row is written. All methods are safe to call from any thread.
//
// Durability: WAL journal with synchronous=NORMAL (commits are not fsynced; checkpoints
// are). A commit reaches the operating system before Drain returns, so it survives the
// process ending in any way (exit, _exit, a signal, a crash); on power loss or a kernel
// crash the last commits before the loss may be missing, but the database stays
// consistent. In exchange, a commit costs no fsync.
//
// The database uses 16 KiB pages (set when the file is created) and keeps its WAL file at
// most 64 MiB after a checkpoint. Checkpoints run on a thread and connection of their own
// (passive: they never hold the writer up) once 1,000 WAL pages wait to be copied; once
// the WAL holds 64 MiB, the writer copies the rest itself so that the WAL starts over.
//
// Failures: a batch whose transaction fails is tried once more, then record by record,
// each in a transaction of its own, so that only a record that fails on its own (a
// constraint, a value too big) is lost; each such loss is logged. A failure of the
// database as a whole (disk full, read-only file, database locked beyond the busy
// timeout, I/O error) loses the rest of the batch at once: it is logged at error level
// with SQLite's message when the store enters that state or its error changes, the losses
// are counted while it lasts, and the first commit afterwards logs how many records were
// lost meanwhile. Later batches always try again, so writing resumes once there is room.
// Every lost record counts in Stats::failed. When the queue holds
// Options::max_queued_records records, further records are dropped and counted (logged
// by the writer), so a dead disk cannot eat memory.
class ReportingStore {
 public:
  struct Options {
    // Records beyond this many waiting in the queue are dropped (and counted).
    std::size_t max_queued_records = 1'000'000;
    // How long a write waits for a lock held by another connection before it fails.
    int busy_timeout_ms = 2000;
    // Retention (see Retention): the database file's size limit in bytes; nullopt: 10% of
    // its file system, at most 4 GiB; 0: none.
    std::optional<std::uint64_t> max_bytes;
    // Rows older than this many seconds are removed; 0: no age limit.
    double max_age_seconds = 0;
  };

  // What the store has done so far.
  struct Stats {
    std::uint64_t handed_over = 0;  // records accepted into the queue
    std::uint64_t committed = 0;    // records in committed transactions
    std::uint64_t failed = 0;       // records that could not be written (see Failures)
    std::uint64_t dropped_queue_full = 0;
    std::uint64_t batches = 0;              // transactions attempted
    std::uint64_t retention_removed = 0;    // rows removed by retention
    std::uint64_t retention_lost = 0;       // of them, rows no exporter had shipped yet
    std::uint64_t bytes_on_disk = 0;        // of the database file, as of the last look
    std::optional<double> oldest_row_time;  // wall-clock seconds; nullopt: no row
  };

  // Opens (creating when missing) the database at `path`, creates or checks its schema
  // and starts the writer thread. `log` receives the store's error lines (default log
  // scope); it may be null (no logging). On failure (the file cannot be opened or
  // created, it is not a database, or its schema is newer than this program's) returns
  // null and sets *error when `error` is not null.
  // REQUIRES: the folder of `path` exists.
  static std::shared_ptr<ReportingStore> Open(const std::string& path, std::shared_ptr<Log> log,
                                              Options options, std::optional<Error>* error);
  static std::shared_ptr<ReportingStore> Open(const std::string& path, std::shared_ptr<Log> log,
                                              std::optional<Error>* error) {
    return Open(path, std::move(log), Options{}, error);
  }

  // Drains and closes (see Close).
  ~ReportingStore();
  ReportingStore(const ReportingStore&) = delete;
  ReportingStore& operator=(const ReportingStore&) = delete;

  // A new framework-session row id: monotonic, above every id in the database at open.
  // The id can be used by AddSessionMessage before the session row is written.
  std::int64_t NewSessionId();

  // Each Add* hands one record over and returns true, or returns false when the record was
  // dropped (the queue is full, or the store is closed). `time` of every row is the wall
  // clock at hand-over.

  // A livo_sessions row. `session_info` and `user_info` are written as JSON.
  // REQUIRES: `id` came from NewSessionId and is added once.
  bool AddSession(std::int64_t id, Value session_info, Value user_info);

  // Sets the flushed time of session `id` to now. `done` (may be empty) is called once on
  // the writer thread after the transaction holding the update ended: with nullopt when it
  // committed, with the error when it failed. A flush is never dropped for a full queue;
  // when the store is closed, `done` runs on a thread of its own with an error.
  void MarkSessionFlushed(std::int64_t id, std::function<void(std::optional<Error>)> done);

  // A new livo_sessions row, as AddSession with an id from NewSessionId, except that the id
  // is taken in queue order: session ids then grow in the order rows are committed, so a
  // reader that follows the ids misses none. Returns the id (also when the row was
  // dropped).
  std::int64_t AddNewSession(Value session_info, Value user_info);

  // A livo_messages row of session `session` (an id from NewSessionId).
  bool AddSessionMessage(std::int64_t session, std::uint16_t category, std::uint16_t type,
                         Value payload);

  // A livo_messages row of no session, with the message's own session and user info.
  bool AddSingleMessage(Value session_info, Value user_info, std::uint16_t category,
                        std::uint16_t type, Value payload);

  // An analytics_events row. `provider` (may be empty: payload null) is called once, on the
  // writer thread, when the row is written; it is not called when the record is dropped.
  // `held_bytes` (what the provider keeps alive) counts in BacklogBytes until then.
  bool AddAnalyticsEvent(std::string name, std::function<Value()> provider,
                         std::size_t held_bytes = 0);

  // A powerlog_events row.
  bool AddPowerLogEvent(std::int32_t subsystem, std::string name, Value payload);

  // Runs `task` once on the writer thread after the transaction that follows everything
  // handed over before it has ended (committed or failed). Never dropped for a full queue;
  // when the store is closed, `task` runs on a thread of its own.
  void AfterWrite(std::function<void()> task);

  // Blocks until every record handed over before the call has been written (committed or
  // failed). Returns at once when called on the writer thread (from a flush handler, a
  // provider or a task), as waiting there could never end, and after Close.
  void Drain();

  // A function that drains this store, for shutdown paths (the daemon's exit hook, its
  // SIGTERM handling): it holds the store weakly, so keeping it does not keep the store
  // open, and does nothing once the store is gone. Not async-signal-safe: call it from a
  // normal thread, never from inside a signal handler.
  std::function<void()> DrainHook() const;

  // Drains, stops the writer thread and closes the database. Later Add* calls return false.
  // Called on the writer thread itself (the last reference dropped in a callback), it
  // returns without waiting and the writer finishes the queue on its own.
  void Close();

  Stats stats() const;
  // Records handed over and not yet written (the store's lag). Lock-free: cheap enough to
  // ask before every request.
  std::uint64_t Backlog() const;
  // The approximate bytes (Value::ApproximateBytes) of those records' payloads. Lock-free.
  // A record's bytes also count, until it is written, in the HeldBytes account (kStore)
  // that was charged on the thread that handed it over (HeldBytes::Charge), if any.
  std::uint64_t BacklogBytes() const;
  // Whether the store still takes records (not closed).
  bool IsOpen() const;
  const std::string& path() const { return path_; }

  // Calls `callback` on the writer thread after each transaction (the backlog just shrank).
  // Replaces the one set before; empty removes it. It must not block.
  void SetAfterBatch(std::function<void()> callback);

  // Runs `sql` on the writer's connection, in queue order, inside the transaction of the
  // batch it lands in; a failure is logged and does not fail the batch. For fault
  // injection in tests only (PRAGMA max_page_count to simulate a full disk).
  void ExecuteForTesting(std::string sql);

  // Made by Open (the writer type is private to the implementation).
  ReportingStore(std::string path, std::shared_ptr<ReportingStoreWriter> writer);

 private:
  std::string path_;
  std::shared_ptr<ReportingStoreWriter> writer_;
};

// Drains every store of this process that is still open. For exit paths that cannot
// reach the store object. The same runs by itself at a normal process exit (std::exit or
// a return from main), so that a store that is still open then loses nothing; _exit and
// signals skip it, which is what DrainHook is for. Not async-signal-safe.
void DrainAllReportingStores();

// The error domain of the store's errors.
inline constexpr const char* kReportingStoreErrorDomain = "com.norvel.quenta.reportingstore";

}  // namespace qn
