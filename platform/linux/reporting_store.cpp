#include "platform/linux/reporting_store.h"

#include <sqlite3.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <exception>
#include <mutex>
#include <span>
#include <thread>
#include <utility>
#include <vector>

#include "common/Json.h"

// An error line to the store's log, when it has one.
#define QN_STORE_ERROR(format, ...)                                                \
  do {                                                                             \
    if (log_) QN_LOG(*log_, nullptr, ::qn::LogLevel::kError, format, __VA_ARGS__); \
  } while (0)

namespace qn {
namespace {

// The schema this program writes. Version 1: the four tables below.
constexpr int kSchemaVersion = 1;

constexpr const char* kCreateSchema = R"sql(
CREATE TABLE IF NOT EXISTS livo_sessions(
  id INTEGER PRIMARY KEY,
  session_info TEXT NOT NULL,
  user_info TEXT NOT NULL,
  created REAL NOT NULL,
  flushed REAL
);
CREATE TABLE IF NOT EXISTS livo_messages(
  id INTEGER PRIMARY KEY,
  session INTEGER REFERENCES livo_sessions(id),
  category INTEGER NOT NULL,
  type INTEGER NOT NULL,
  payload TEXT NOT NULL,
  session_info TEXT,
  user_info TEXT,
  time REAL NOT NULL
);
CREATE TABLE IF NOT EXISTS analytics_events(
  id INTEGER PRIMARY KEY,
  name TEXT NOT NULL,
  payload TEXT NOT NULL,
  time REAL NOT NULL
);
CREATE TABLE IF NOT EXISTS powerlog_events(
  id INTEGER PRIMARY KEY,
  subsystem INTEGER NOT NULL,
  name TEXT NOT NULL,
  payload TEXT NOT NULL,
  time REAL NOT NULL
);
PRAGMA user_version = 1;
)sql";

// A vector that grew beyond this many records for a burst is given back afterwards.
constexpr std::size_t kKeptQueueCapacity = 1 << 18;
// How long and up to how many records the writer gathers before a transaction.
constexpr auto kGatherTime = std::chrono::milliseconds(2);
constexpr std::size_t kGatherRecords = 512;

double WallNow() {
  timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
}

struct DbCloser {
  void operator()(sqlite3* db) const { sqlite3_close_v2(db); }
};
struct StmtFinalizer {
  void operator()(sqlite3_stmt* stmt) const { sqlite3_finalize(stmt); }
};
using DbHandle = std::unique_ptr<sqlite3, DbCloser>;
using Statement = std::unique_ptr<sqlite3_stmt, StmtFinalizer>;

Error SqliteError(sqlite3* db, int rc, const std::string& what) {
  std::string message = db ? sqlite3_errmsg(db) : sqlite3_errstr(rc);
  return Error{kReportingStoreErrorDomain, rc, what + ": " + message};
}

// Runs `task` on a short-lived thread of its own: for callbacks that must not run on the
// caller's stack when the writer thread is gone.
void RunDetached(std::function<void()> task) { std::thread(std::move(task)).detach(); }

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
  std::size_t bytes = 0;  // the payload's approximate size, counted in backlog_bytes_
  std::unique_ptr<RecordExtra> extra;
};

// Whether a failure with SQLite result code `rc` is the database's as a whole (no room,
// no permission, a lock, an I/O error) rather than one record's: every other record would
// fail the same way.
bool FailsEveryRecord(int rc) {
  switch (rc & 0xff) {
    case SQLITE_FULL:
    case SQLITE_READONLY:
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
    case SQLITE_IOERR:
    case SQLITE_CANTOPEN:
    case SQLITE_NOMEM:
    case SQLITE_PERM:
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
    case SQLITE_PROTOCOL:
      return true;
    default:
      return false;
  }
}

// The name of a record's kind in log lines.
const char* KindName(RecordKind kind) {
  switch (kind) {
    case RecordKind::kSession:
      return "session";
    case RecordKind::kFlush:
      return "session flush";
    case RecordKind::kSessionMessage:
    case RecordKind::kSingleMessage:
      return "message";
    case RecordKind::kAnalytics:
      return "analytics event";
    case RecordKind::kPowerLog:
      return "power-log event";
    case RecordKind::kTask:
    case RecordKind::kExec:
      break;
  }
  return "control";
}

}  // namespace

// WAL pages not yet copied after which a checkpoint is due (SQLite's own default).
constexpr int kCheckpointPages = 1000;

// Copies the WAL into the database file on a thread and a connection of its own, so that
// the writer's commits never wait for a checkpoint (which fsyncs the database and, after a
// burst, copies tens of megabytes: long enough to stall every client the store holds back).
// The writer turns its own automatic checkpoints off and tells this one of each commit from
// its WAL hook.
class Checkpointer {
 public:
  // Null when the second connection cannot be opened (the writer then checkpoints itself).
  static std::unique_ptr<Checkpointer> Start(const char* path, int busy_timeout_ms) {
    sqlite3* raw = nullptr;
    const int rc =
        sqlite3_open_v2(path, &raw, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
    DbHandle db(raw);
    if (rc != SQLITE_OK) return nullptr;
    sqlite3_busy_timeout(db.get(), busy_timeout_ms);
    // A connection learns that the database is in WAL mode when it first reads it; until
    // then a checkpoint through it does nothing at all and the WAL grows without end.
    if (sqlite3_exec(db.get(), "SELECT count(*) FROM sqlite_schema", nullptr, nullptr, nullptr) !=
        SQLITE_OK) {
      return nullptr;
    }
    return std::unique_ptr<Checkpointer>(new Checkpointer(std::move(db)));
  }

  // Stops the thread (after the checkpoint in progress) and closes the connection.
  ~Checkpointer() {
    {
      std::lock_guard lock(mu_);
      stop_ = true;
    }
    cv_.notify_all();
    thread_.join();
  }

  // Writer thread, after each commit that left `wal_frames` in the WAL: wakes the thread
  // once kCheckpointPages of them wait to be copied. (Waking it after every commit made it
  // copy a commit or two and fsync the database over a hundred times a second.)
  void Committed(int wal_frames) {
    int copied = copied_.load(std::memory_order_relaxed);
    if (wal_frames < copied) copied = 0;  // the WAL has started over
    if (wal_frames - copied < kCheckpointPages) return;
    {
      std::lock_guard lock(mu_);
      if (running_) return;  // it looks again when that checkpoint is done
      due_ = true;
    }
    cv_.notify_all();
  }

  // Whether no checkpoint runs or is due.
  bool Idle() {
    std::lock_guard lock(mu_);
    return !running_ && !due_;
  }

  // Waits for the checkpoint in progress, if any, and drops a due one: the caller is about
  // to checkpoint through its own connection.
  void Yield() {
    std::unique_lock lock(mu_);
    due_ = false;
    cv_.wait(lock, [&] { return !running_; });
  }

 private:
  explicit Checkpointer(DbHandle db) : db_(std::move(db)), thread_([this] { Run(); }) {}

  void Run() {
    std::unique_lock lock(mu_);
    for (;;) {
      cv_.wait(lock, [&] { return due_ || stop_; });
      if (stop_) return;
      due_ = false;
      running_ = true;
      lock.unlock();
      // PASSIVE: copies what it can without waiting for the writer, which goes on.
      int wal_frames = 0;
      int copied = 0;
      if (sqlite3_wal_checkpoint_v2(db_.get(), nullptr, SQLITE_CHECKPOINT_PASSIVE, &wal_frames,
                                    &copied) == SQLITE_OK) {
        copied_.store(copied, std::memory_order_relaxed);
      }
      lock.lock();
      running_ = false;
      cv_.notify_all();
    }
  }

  DbHandle db_;
  std::mutex mu_;
  std::condition_variable cv_;
  bool due_ = false;            // guarded by mu_
  bool stop_ = false;           // guarded by mu_
  bool running_ = false;        // guarded by mu_
  std::atomic<int> copied_{0};  // WAL frames the last checkpoint left copied
  std::thread thread_;
};

// WAL pages after which the writer finishes the checkpoint itself between two transactions.
// While records keep coming, the checkpointer never catches up with the last commit, and
// SQLite starts the WAL over only once every frame in it has been copied: without this the
// WAL of a long burst grows by every byte written. The writer copies only what the
// checkpointer left; its pause is mostly the fsync of the database. 4096 pages of 16 KiB
// are the 64 MiB the WAL is cut back to (journal_size_limit).
constexpr int kWrapPages = 4096;

// The writer: owns the connection, the queue and the writer thread. The thread holds a
// reference to it, so it outlives the ReportingStore when the store is closed from the
// writer thread itself.
class ReportingStoreWriter : public std::enable_shared_from_this<ReportingStoreWriter> {
 public:
  ReportingStoreWriter(DbHandle db, std::shared_ptr<Log> log, ReportingStore::Options options,
                       std::int64_t next_session_id)
      : db_(std::move(db)),
        log_(std::move(log)),
        options_(options),
        next_session_id_(next_session_id) {}

  ~ReportingStoreWriter() {
    // Only reached once the thread has ended (joined or detached and finished).
    if (thread_.joinable()) thread_.detach();
  }

  // Prepares the statements. On failure returns the error and the writer must not start.
  std::optional<Error> Prepare() {
    struct {
      Statement* stmt;
      const char* sql;
    } statements[] = {
        {&begin_, "BEGIN IMMEDIATE"},
        {&commit_, "COMMIT"},
        {&rollback_, "ROLLBACK"},
        {&insert_session_,
         "INSERT INTO livo_sessions(id, session_info, user_info, created) VALUES(?1, ?2, ?3, ?4)"},
        {&flush_session_, "UPDATE livo_sessions SET flushed = ?2 WHERE id = ?1"},
        {&insert_message_,
         "INSERT INTO livo_messages(session, category, type, payload, time) "
         "VALUES(?1, ?2, ?3, ?4, ?5)"},
        {&insert_single_,
         "INSERT INTO livo_messages(session, category, type, payload, session_info, user_info, "
         "time) VALUES(NULL, ?1, ?2, ?3, ?4, ?5, ?6)"},
        {&insert_analytics_,
         "INSERT INTO analytics_events(name, payload, time) VALUES(?1, ?2, ?3)"},
        {&insert_powerlog_,
         "INSERT INTO powerlog_events(subsystem, name, payload, time) VALUES(?1, ?2, ?3, ?4)"},
    };
    for (auto& s : statements) {
      sqlite3_stmt* stmt = nullptr;
      int rc = sqlite3_prepare_v3(db_.get(), s.sql, -1, SQLITE_PREPARE_PERSISTENT, &stmt, nullptr);
      if (rc != SQLITE_OK) return SqliteError(db_.get(), rc, std::string("prepare ") + s.sql);
      s.stmt->reset(stmt);
    }
    checkpointer_ =
        Checkpointer::Start(sqlite3_db_filename(db_.get(), "main"), options_.busy_timeout_ms);
    if (checkpointer_) {
      sqlite3_wal_autocheckpoint(db_.get(), 0);
      sqlite3_wal_hook(
          db_.get(),
          [](void* writer, sqlite3*, const char*, int pages) {
            auto* self = static_cast<ReportingStoreWriter*>(writer);
            self->wal_pages_ = pages;
            self->checkpointer_->Committed(pages);
            return SQLITE_OK;
          },
          this);
    }
    return std::nullopt;
  }

  void Start() {
    auto self = shared_from_this();
    thread_ = std::thread([self] { self->Run(); });
    writer_id_ = thread_.get_id();
  }

  std::int64_t NewSessionId() { return next_session_id_.fetch_add(1, std::memory_order_relaxed); }

  // Hands `record` to the writer. A control record (flush, task) is taken even when the
  // queue is full. Returns false when the record was not taken; a control record's
  // callback is then the caller's to run.
  bool Push(Record&& record, bool control) {
    record.bytes = record.payload.ApproximateBytes();
    std::unique_lock lock(mu_);
    if (closing_) return false;
    if (!control && queue_.size() >= options_.max_queued_records) {
      ++dropped_queue_full_;
      ++stats_.dropped_queue_full;
      return false;
    }
    queue_.push_back(std::move(record));
    ++stats_.handed_over;
    backlog_.fetch_add(1, std::memory_order_relaxed);
    backlog_bytes_.fetch_add(queue_.back().bytes, std::memory_order_relaxed);
    const bool wake = writer_idle_ || (gathering_ && queue_.size() == kGatherRecords);
    writer_idle_ = false;
    lock.unlock();
    if (wake) wake_.notify_one();
    return true;
  }

  void Drain() {
    if (std::this_thread::get_id() == writer_id_) return;
    std::unique_lock lock(mu_);
    const std::uint64_t target = stats_.handed_over;
    ++drains_waiting_;  // the writer does not gather while someone waits
    wake_.notify_one();
    written_cv_.wait(lock, [&] { return written_ >= target || exited_; });
    --drains_waiting_;
  }

  // Stops taking records; the writer finishes what is queued and closes the database.
  // Waits for that unless called on the writer thread.
  void Shutdown() {
    {
      std::lock_guard lock(mu_);
      closing_ = true;
    }
    wake_.notify_one();
    if (std::this_thread::get_id() == writer_id_) {
      std::lock_guard lock(thread_mu_);
      if (thread_.joinable()) thread_.detach();
      return;
    }
    std::lock_guard lock(thread_mu_);
    if (thread_.joinable()) thread_.join();
  }

  ReportingStore::Stats stats() const {
    std::lock_guard lock(mu_);
    return stats_;
  }

  std::uint64_t backlog() const { return backlog_.load(std::memory_order_relaxed); }
  std::uint64_t backlog_bytes() const { return backlog_bytes_.load(std::memory_order_relaxed); }

  void SetAfterBatch(std::function<void()> callback) {
    std::lock_guard lock(mu_);
    after_batch_ = std::move(callback);
  }

  bool open() const {
    std::lock_guard lock(mu_);
    return !closing_;
  }

 private:
  void Run() {
    std::vector<Record> batch;
    for (;;) {
      std::uint64_t dropped = 0;
      std::uint64_t batch_end = 0;
      {
        std::unique_lock lock(mu_);
        while (queue_.empty() && !closing_) {
          writer_idle_ = true;
          wake_.wait(lock);
        }
        writer_idle_ = false;
        if (queue_.empty()) break;  // closing and nothing left
        // A commit costs about as much for a few records as for hundreds: while records
        // keep arriving, gather them for a moment into one transaction.
        const auto gather_until = std::chrono::steady_clock::now() + kGatherTime;
        gathering_ = true;
        while (queue_.size() < kGatherRecords && !closing_ && drains_waiting_ == 0 &&
               wake_.wait_until(lock, gather_until) != std::cv_status::timeout) {
        }
        gathering_ = false;
        batch.swap(queue_);
        dropped = std::exchange(dropped_queue_full_, 0);
        batch_end = stats_.handed_over;
      }
      if (dropped > 0) LogQueueFull(dropped);

      if (wal_pages_ >= kWrapPages) FinishCheckpoint();
      std::optional<Error> error = WriteBatch(batch);
      RunCallbacks(batch, error);

      const std::uint64_t count = batch.size();
      const auto failed = static_cast<std::uint64_t>(
          std::count_if(batch.begin(), batch.end(), [](const Record& r) { return r.failed; }));
      std::uint64_t bytes = 0;
      for (const Record& r : batch) bytes += r.bytes;
      batch.clear();
      if (batch.capacity() > kKeptQueueCapacity) batch.shrink_to_fit();
      {
        std::lock_guard lock(mu_);
        ++stats_.batches;
        stats_.failed += failed;
        stats_.committed += count - failed;
        written_ = batch_end;
      }
      backlog_.fetch_sub(count, std::memory_order_relaxed);
      backlog_bytes_.fetch_sub(bytes, std::memory_order_relaxed);
      std::function<void()> after_batch;
      {
        std::lock_guard lock(mu_);
        after_batch = after_batch_;
      }
      if (after_batch) after_batch();
      written_cv_.notify_all();
    }
    std::uint64_t dropped = 0;
    {
      std::lock_guard lock(mu_);
      dropped = std::exchange(dropped_queue_full_, 0);
    }
    if (dropped > 0) LogQueueFull(dropped);
    CloseDatabase();
    {
      std::lock_guard lock(mu_);
      exited_ = true;
    }
    written_cv_.notify_all();
  }

  // Copies what is left of the WAL into the database, so that the next commit starts the
  // WAL over (the commits wait meanwhile, mostly for the fsyncs). While the checkpointer is
  // at work the writer goes on and looks again at the next batch; only a WAL twice past
  // kWrapPages (a disk slower than the writer) makes it wait for that checkpoint. When a
  // reader still holds old frames, the next batch tries again.
  void FinishCheckpoint() {
    if (wal_pages_ < 2 * kWrapPages && !checkpointer_->Idle()) return;
    checkpointer_->Yield();
    int wal_frames = 0;
    int copied = 0;
    const int rc = sqlite3_wal_checkpoint_v2(db_.get(), nullptr, SQLITE_CHECKPOINT_PASSIVE,
                                             &wal_frames, &copied);
    if (rc == SQLITE_OK && copied == wal_frames) wal_pages_ = 0;
  }

  void CloseDatabase() {
    // Its connection goes first, so that closing the writer's (the last one) checkpoints
    // everything and removes the WAL file.
    sqlite3_wal_hook(db_.get(), nullptr, nullptr);
    checkpointer_.reset();
    for (Statement* s :
         {&begin_, &commit_, &rollback_, &insert_session_, &flush_session_, &insert_message_,
          &insert_single_, &insert_analytics_, &insert_powerlog_}) {
      s->reset();
    }
    int rc = sqlite3_close(db_.get());
    if (rc != SQLITE_OK) {
      QN_STORE_ERROR("%s:%d:%s: reporting store: closing the database failed: %s (%d)",
                     sqlite3_errmsg(db_.get()), rc);
      return;  // the handle's deleter retries with sqlite3_close_v2
    }
    (void)db_.release();
  }

  // Writes `batch` in one transaction; when that fails, once more; when that fails too,
  // record by record, each in a transaction of its own, so that only a record that fails
  // on its own is lost (logged and counted each). A failure of the database as a whole
  // (FailsEveryRecord) loses the rest of the batch at once, as every record would fail the
  // same way; it is logged when the database enters that state (or its error changes), not
  // for every batch, and the next commit logs that writing works again. Marks every lost
  // record `failed`; returns the last error, or nullopt when nothing was lost.
  std::optional<Error> WriteBatch(std::vector<Record>& batch) {
    const auto all = std::span<Record>(batch);
    std::optional<Failure> failure = WriteTransaction(all);
    if (failure) failure = WriteTransaction(all);
    if (!failure) return std::nullopt;
    if (FailsEveryRecord(failure->rc)) return LoseAll(all, *failure);
    std::optional<Error> last;
    for (std::size_t i = 0; i < batch.size(); ++i) {
      failure = WriteTransaction(all.subspan(i, 1));
      if (!failure) continue;
      if (FailsEveryRecord(failure->rc)) return LoseAll(all.subspan(i), *failure);
      batch[i].failed = true;
      QN_STORE_ERROR(
          "%s:%d:%s: reporting store: dropped a %s record that cannot be written: %s (%d)",
          KindName(batch[i].kind), failure->message, failure->rc);
      last = failure->error;
    }
    return last;
  }

  // Why a transaction failed: the step, SQLite's result code and message, as an Error.
  struct Failure {
    int rc;
    std::string message;
    Error error;
  };

  // Writes `records` in one transaction and commits; on failure rolls back.
  std::optional<Failure> WriteTransaction(std::span<Record> records) {
    int rc = Step(begin_.get());
    if (rc != SQLITE_DONE) return Fail(rc, "begin");
    for (Record& record : records) {
      rc = WriteRecord(record);
      if (rc != SQLITE_DONE) return Fail(rc, "insert");
    }
    rc = Step(commit_.get());
    if (rc != SQLITE_DONE) return Fail(rc, "commit");
    if (failing_rc_ != 0) {
      if (log_) {
        QN_LOG(*log_, nullptr, LogLevel::kDefault,
               "%s:%d:%s: reporting store: writing again; %llu records were lost meanwhile",
               static_cast<unsigned long long>(lost_while_failing_));
      }
      failing_rc_ = 0;
      lost_while_failing_ = 0;
    }
    return std::nullopt;
  }

  Failure Fail(int rc, const char* step) {
    sqlite3* db = db_.get();
    Failure failure{rc, sqlite3_errmsg(db),
                    SqliteError(db, rc, std::string("reporting store ") + step)};
    failure.message = std::string(step) + " failed: " + failure.message;
    if (!sqlite3_get_autocommit(db)) Step(rollback_.get());
    return failure;
  }

  // Marks `records` lost by a failure of the whole database; logs it on a change of state.
  std::optional<Error> LoseAll(std::span<Record> records, const Failure& failure) {
    for (Record& r : records) r.failed = true;
    lost_while_failing_ += records.size();
    if (failure.rc != failing_rc_) {
      failing_rc_ = failure.rc;
      QN_STORE_ERROR(
          "%s:%d:%s: reporting store: %s (%d), dropped a batch of %llu records; further "
          "losses are counted until a write succeeds",
          failure.message, failure.rc, static_cast<unsigned long long>(records.size()));
    }
    return failure.error;
  }

  // Runs a statement that returns no rows and resets it. Returns SQLite's result code.
  static int Step(sqlite3_stmt* stmt) {
    int rc = sqlite3_step(stmt);
    sqlite3_reset(stmt);
    return rc;
  }

  // Binds the JSON text of `value`, written into `buffer`, which must then stay untouched
  // until the statement has run.
  static void BindJson(sqlite3_stmt* stmt, int index, std::string& buffer, const Value& value) {
    buffer.clear();
    AppendJsonLenient(buffer, value);
    BindText(stmt, index, buffer);
  }

  static void BindText(sqlite3_stmt* stmt, int index, const std::string& text) {
    sqlite3_bind_text(stmt, index, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
  }

  int WriteRecord(Record& r) {
    sqlite3_stmt* stmt = nullptr;
    switch (r.kind) {
      case RecordKind::kSessionMessage:
        stmt = insert_message_.get();
        sqlite3_bind_int64(stmt, 1, r.id);
        sqlite3_bind_int(stmt, 2, r.category);
        sqlite3_bind_int(stmt, 3, r.type);
        BindJson(stmt, 4, json_payload_, r.payload);
        sqlite3_bind_double(stmt, 5, r.time);
        break;
      case RecordKind::kSingleMessage:
        stmt = insert_single_.get();
        sqlite3_bind_int(stmt, 1, r.category);
        sqlite3_bind_int(stmt, 2, r.type);
        BindJson(stmt, 3, json_payload_, r.payload);
        BindJson(stmt, 4, json_session_info_, r.extra->session_info);
        BindJson(stmt, 5, json_user_info_, r.extra->user_info);
        sqlite3_bind_double(stmt, 6, r.time);
        break;
      case RecordKind::kSession:
        stmt = insert_session_.get();
        sqlite3_bind_int64(stmt, 1, r.id);
        BindJson(stmt, 2, json_session_info_, r.extra->session_info);
        BindJson(stmt, 3, json_user_info_, r.extra->user_info);
        sqlite3_bind_double(stmt, 4, r.time);
        break;
      case RecordKind::kFlush:
        stmt = flush_session_.get();
        sqlite3_bind_int64(stmt, 1, r.id);
        sqlite3_bind_double(stmt, 2, r.time);
        break;
      case RecordKind::kAnalytics: {
        stmt = insert_analytics_.get();
        // Called at most once; its payload is kept for a retry of the record.
        if (r.extra->provider) r.payload = CallProvider(r.extra->provider, r.extra->name);
        r.extra->provider = nullptr;
        BindText(stmt, 1, r.extra->name);
        BindJson(stmt, 2, json_payload_, r.payload);
        sqlite3_bind_double(stmt, 3, r.time);
        break;
      }
      case RecordKind::kPowerLog:
        stmt = insert_powerlog_.get();
        sqlite3_bind_int(stmt, 1, r.subsystem);
        BindText(stmt, 2, r.extra->name);
        BindJson(stmt, 3, json_payload_, r.payload);
        sqlite3_bind_double(stmt, 4, r.time);
        break;
      case RecordKind::kExec: {
        char* message = nullptr;
        int rc = sqlite3_exec(db_.get(), r.extra->name.c_str(), nullptr, nullptr, &message);
        if (rc != SQLITE_OK) {
          QN_STORE_ERROR("%s:%d:%s: reporting store: %s failed: %s (%d)", r.extra->name,
                         message ? message : "", rc);
        }
        sqlite3_free(message);
        return SQLITE_DONE;
      }
      case RecordKind::kTask:
        return SQLITE_DONE;
    }
    return Step(stmt);
  }

  Value CallProvider(const std::function<Value()>& provider, const std::string& name) {
    try {
      return provider();
    } catch (const std::exception& e) {
      QN_STORE_ERROR("%s:%d:%s: reporting store: payload provider of %s threw: %s", name, e.what());
    } catch (...) {
      QN_STORE_ERROR("%s:%d:%s: reporting store: payload provider of %s threw", name);
    }
    return Value();
  }

  // Calls the flush handlers and tasks of a written batch, in queue order.
  void RunCallbacks(std::vector<Record>& batch, const std::optional<Error>& error) {
    for (Record& r : batch) {
      if (r.kind == RecordKind::kFlush && r.extra && r.extra->flushed) {
        r.extra->flushed(r.failed ? error : std::nullopt);
      } else if (r.kind == RecordKind::kTask && r.extra && r.extra->task) {
        r.extra->task();
      }
    }
  }

  void LogQueueFull(std::uint64_t dropped) {
    QN_STORE_ERROR("%s:%d:%s: reporting store: queue full (%llu records), dropped %llu records",
                   static_cast<unsigned long long>(options_.max_queued_records),
                   static_cast<unsigned long long>(dropped));
  }

  // Writer-thread state: the connection, its statements, the JSON buffers.
  DbHandle db_;
  std::unique_ptr<Checkpointer> checkpointer_;  // writer thread (set before it starts)
  int wal_pages_ = 0;  // writer thread: frames in the WAL after the last commit
  Statement begin_, commit_, rollback_;
  Statement insert_session_, flush_session_, insert_message_, insert_single_;
  Statement insert_analytics_, insert_powerlog_;
  std::string json_payload_, json_session_info_, json_user_info_;
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

namespace {

// The open stores of the process, drained by DrainAllReportingStores and at exit.
struct OpenStores {
  std::mutex mu;
  std::vector<std::weak_ptr<ReportingStoreWriter>> writers;
};

OpenStores& Registry() {
  static OpenStores registry;
  return registry;
}

void Register(const std::shared_ptr<ReportingStoreWriter>& writer) {
  OpenStores& registry = Registry();  // constructed before the exit handler is registered,
  static std::once_flag once;         // so it is destroyed after that handler ran
  std::call_once(once, [] { std::atexit([] { DrainAllReportingStores(); }); });
  std::lock_guard lock(registry.mu);
  std::erase_if(registry.writers, [](const auto& w) { return w.expired(); });
  registry.writers.push_back(writer);
}

// Runs one statement that returns no rows, outside the writer.
std::optional<Error> Exec(sqlite3* db, const char* sql, const std::string& what) {
  char* message = nullptr;
  int rc = sqlite3_exec(db, sql, nullptr, nullptr, &message);
  if (rc == SQLITE_OK) return std::nullopt;
  Error error{kReportingStoreErrorDomain, rc,
              what + ": " + (message ? message : sqlite3_errstr(rc))};
  sqlite3_free(message);
  return error;
}

// A single integer from `sql`, or the error.
std::optional<Error> QueryInt(sqlite3* db, const char* sql, std::int64_t* out) {
  sqlite3_stmt* raw = nullptr;
  int rc = sqlite3_prepare_v2(db, sql, -1, &raw, nullptr);
  Statement stmt(raw);
  if (rc != SQLITE_OK) return SqliteError(db, rc, sql);
  rc = sqlite3_step(stmt.get());
  if (rc == SQLITE_ROW) {
    *out = sqlite3_column_int64(stmt.get(), 0);
    return std::nullopt;
  }
  if (rc == SQLITE_DONE) return std::nullopt;
  return SqliteError(db, rc, sql);
}

// Opens the database, sets the journal and creates or checks the schema. Returns the
// first free session id through *next_session_id.
std::optional<Error> OpenDatabase(const std::string& path, const ReportingStore::Options& options,
                                  DbHandle* out, std::int64_t* next_session_id) {
  sqlite3* raw = nullptr;
  int rc =
      sqlite3_open_v2(path.c_str(), &raw,
                      SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
  DbHandle db(raw);
  if (rc != SQLITE_OK) return SqliteError(db.get(), rc, "open " + path);
  sqlite3_busy_timeout(db.get(), options.busy_timeout_ms);

  // WAL with synchronous=NORMAL: a commit is a write to the WAL file without fsync, so it
  // is safe once the call returns as far as the process is concerned; fsyncs happen at
  // checkpoints.
  // 16 KiB pages: a quarter of the page writes (system calls) of the default 4 KiB for the
  // same rows. Takes effect only when the file is created.
  if (auto e = Exec(db.get(), "PRAGMA page_size=16384", "set page size in " + path)) return e;
  if (auto e = Exec(db.get(), "PRAGMA journal_mode=WAL", "set WAL journal in " + path)) return e;
  if (auto e = Exec(db.get(), "PRAGMA synchronous=NORMAL", "set synchronous in " + path)) return e;
  // A big batch grows the WAL file; after a checkpoint it is cut back to this size.
  if (auto e = Exec(db.get(), "PRAGMA journal_size_limit=67108864", "set WAL limit in " + path)) {
    return e;
  }

  std::int64_t version = 0;
  if (auto e = QueryInt(db.get(), "PRAGMA user_version", &version)) return e;
  if (version > kSchemaVersion) {
    return Error{kReportingStoreErrorDomain, SQLITE_ERROR,
                 path + ": schema version " + std::to_string(version) +
                     " is newer than this program's (" + std::to_string(kSchemaVersion) + ")"};
  }
  if (version < kSchemaVersion) {
    std::string sql = std::string("BEGIN IMMEDIATE;") + kCreateSchema + "COMMIT;";
    if (auto e = Exec(db.get(), sql.c_str(), "create schema in " + path)) {
      Exec(db.get(), "ROLLBACK", "rollback");
      return e;
    }
  }
  std::int64_t max_id = 0;
  if (auto e = QueryInt(db.get(), "SELECT IFNULL(MAX(id), 0) FROM livo_sessions", &max_id)) {
    return e;
  }
  *next_session_id = max_id + 1;
  *out = std::move(db);
  return std::nullopt;
}

Record MakeRecord(RecordKind kind) {
  Record r;
  r.kind = kind;
  r.time = WallNow();
  return r;
}

}  // namespace

std::shared_ptr<ReportingStore> ReportingStore::Open(const std::string& path,
                                                     std::shared_ptr<Log> log, Options options,
                                                     std::optional<Error>* error) {
  DbHandle db;
  std::int64_t next_session_id = 1;
  std::optional<Error> failure = OpenDatabase(path, options, &db, &next_session_id);
  std::shared_ptr<ReportingStoreWriter> writer;
  if (!failure) {
    writer = std::make_shared<ReportingStoreWriter>(std::move(db), std::move(log), options,
                                                    next_session_id);
    failure = writer->Prepare();
  }
  if (failure) {
    if (error) *error = std::move(failure);
    return nullptr;
  }
  writer->Start();
  Register(writer);
  return std::make_shared<ReportingStore>(path, std::move(writer));
}

ReportingStore::ReportingStore(std::string path, std::shared_ptr<ReportingStoreWriter> writer)
    : path_(std::move(path)), writer_(std::move(writer)) {}

ReportingStore::~ReportingStore() { Close(); }

void ReportingStore::Close() { writer_->Shutdown(); }

std::int64_t ReportingStore::NewSessionId() { return writer_->NewSessionId(); }

bool ReportingStore::AddSession(std::int64_t id, Value session_info, Value user_info) {
  Record r = MakeRecord(RecordKind::kSession);
  r.id = id;
  r.extra = std::make_unique<RecordExtra>();
  r.extra->session_info = std::move(session_info);
  r.extra->user_info = std::move(user_info);
  return writer_->Push(std::move(r), false);
}

void ReportingStore::MarkSessionFlushed(std::int64_t id,
                                        std::function<void(std::optional<Error>)> done) {
  Record r = MakeRecord(RecordKind::kFlush);
  r.id = id;
  r.extra = std::make_unique<RecordExtra>();
  r.extra->flushed = std::move(done);
  if (writer_->Push(std::move(r), true)) return;
  // Push leaves the record alone when it refuses it.
  if (r.extra->flushed) {
    RunDetached([done = std::move(r.extra->flushed)] {
      done(Error{kReportingStoreErrorDomain, SQLITE_MISUSE, "the reporting store is closed"});
    });
  }
}

bool ReportingStore::AddSessionMessage(std::int64_t session, std::uint16_t category,
                                       std::uint16_t type, Value payload) {
  Record r = MakeRecord(RecordKind::kSessionMessage);
  r.id = session;
  r.category = category;
  r.type = type;
  r.payload = std::move(payload);
  return writer_->Push(std::move(r), false);
}

bool ReportingStore::AddSingleMessage(Value session_info, Value user_info, std::uint16_t category,
                                      std::uint16_t type, Value payload) {
  Record r = MakeRecord(RecordKind::kSingleMessage);
  r.category = category;
  r.type = type;
  r.payload = std::move(payload);
  r.extra = std::make_unique<RecordExtra>();
  r.extra->session_info = std::move(session_info);
  r.extra->user_info = std::move(user_info);
  return writer_->Push(std::move(r), false);
}

bool ReportingStore::AddAnalyticsEvent(std::string name, std::function<Value()> provider) {
  Record r = MakeRecord(RecordKind::kAnalytics);
  r.extra = std::make_unique<RecordExtra>();
  r.extra->name = std::move(name);
  r.extra->provider = std::move(provider);
  return writer_->Push(std::move(r), false);
}

bool ReportingStore::AddPowerLogEvent(std::int32_t subsystem, std::string name, Value payload) {
  Record r = MakeRecord(RecordKind::kPowerLog);
  r.subsystem = subsystem;
  r.payload = std::move(payload);
  r.extra = std::make_unique<RecordExtra>();
  r.extra->name = std::move(name);
  return writer_->Push(std::move(r), false);
}

void ReportingStore::AfterWrite(std::function<void()> task) {
  Record r = MakeRecord(RecordKind::kTask);
  r.extra = std::make_unique<RecordExtra>();
  r.extra->task = std::move(task);
  if (writer_->Push(std::move(r), true)) return;
  if (r.extra->task) RunDetached(std::move(r.extra->task));
}

void ReportingStore::ExecuteForTesting(std::string sql) {
  Record r = MakeRecord(RecordKind::kExec);
  r.extra = std::make_unique<RecordExtra>();
  r.extra->name = std::move(sql);
  writer_->Push(std::move(r), true);
}

void ReportingStore::Drain() { writer_->Drain(); }

std::function<void()> ReportingStore::DrainHook() const {
  std::weak_ptr<ReportingStoreWriter> weak = writer_;
  return [weak] {
    if (auto writer = weak.lock()) writer->Drain();
  };
}

ReportingStore::Stats ReportingStore::stats() const { return writer_->stats(); }

std::uint64_t ReportingStore::Backlog() const { return writer_->backlog(); }
std::uint64_t ReportingStore::BacklogBytes() const { return writer_->backlog_bytes(); }

bool ReportingStore::IsOpen() const { return writer_->open(); }

void ReportingStore::SetAfterBatch(std::function<void()> callback) {
  writer_->SetAfterBatch(std::move(callback));
}

void DrainAllReportingStores() {
  std::vector<std::shared_ptr<ReportingStoreWriter>> writers;
  {
    OpenStores& registry = Registry();
    std::lock_guard lock(registry.mu);
    for (const auto& weak : registry.writers) {
      if (auto writer = weak.lock()) writers.push_back(std::move(writer));
    }
  }
  for (const auto& writer : writers) writer->Drain();
}

}  // namespace qn
