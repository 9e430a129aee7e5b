#include "platform/linux/store/writer.h"

#include <algorithm>
#include <chrono>
#include <exception>
#include <utility>

#include "common/Json.h"
#include "platform/linux/store/schema.h"

// An error line to the store's log, when it has one.
#define QN_STORE_ERROR(format, ...)                                                \
  do {                                                                             \
    if (log_) QN_LOG(*log_, nullptr, ::qn::LogLevel::kError, format, __VA_ARGS__); \
  } while (0)

namespace qn {
namespace {

using store::Checkpointer;
using store::SqliteError;
using store::Step;

// A vector that grew beyond this many records for a burst is given back afterwards.
constexpr std::size_t kKeptQueueCapacity = 1 << 18;
// How long and up to how many records the writer gathers before a transaction.
constexpr auto kGatherTime = std::chrono::milliseconds(2);
constexpr std::size_t kGatherRecords = 512;
// How often an idle writer lets retention look at the limits.
constexpr auto kRetentionInterval = std::chrono::seconds(1);

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

// The tables whose ids the writer assigns, by ReportingStoreWriter::Table.
constexpr const char* kTableNames[] = {"store_sessions", "store_messages", "store_analytics",
                                       "store_powerlog"};

}  // namespace

// WAL pages after which the writer finishes the checkpoint itself between two transactions.
// While records keep coming, the checkpointer never catches up with the last commit, and
// SQLite starts the WAL over only once every frame in it has been copied: without this the
// WAL of a long burst grows by every byte written. The writer copies only what the
// checkpointer left; its pause is mostly the fsync of the database. 4096 pages of 16 KiB
// are the 64 MiB the WAL is cut back to (journal_size_limit).
constexpr int kWrapPages = 4096;

ReportingStoreWriter::ReportingStoreWriter(DbHandle db, std::shared_ptr<Log> log,
                                           ReportingStore::Options options,
                                           std::int64_t next_session_id)
    : db_(std::move(db)),
      log_(std::move(log)),
      options_(options),
      next_session_id_(next_session_id) {}

ReportingStoreWriter::~ReportingStoreWriter() {
  // Only reached once the thread has ended (joined or detached and finished).
  if (thread_.joinable()) thread_.detach();
}

std::optional<Error> ReportingStoreWriter::Ready() {
  if (ready_) return std::nullopt;
  const std::string path = sqlite3_db_filename(db_.get(), "main");
  if (auto e = store::MigrateSchema(db_.get(), path, log_.get())) return e;
  store::EnsureIncrementalVacuum(db_.get(), path, log_.get());
  if (auto e = Prepare()) return e;
  ready_ = true;
  return std::nullopt;
}

std::optional<Error> ReportingStoreWriter::Prepare() {
  struct {
    Statement* stmt;
    const char* sql;
  } statements[] = {
      {&begin_, "BEGIN IMMEDIATE"},
      {&commit_, "COMMIT"},
      {&rollback_, "ROLLBACK"},
      {&insert_session_,
       "INSERT INTO store_sessions(id, session_info, user_info, created) VALUES(?1, ?2, ?3, ?4)"},
      {&flush_session_, "UPDATE store_sessions SET flushed = ?2 WHERE id = ?1"},
      {&set_last_message_, "UPDATE store_sessions SET last_message = ?2 WHERE id = ?1"},
      {&insert_message_,
       "INSERT INTO store_messages(session, category, type, payload, time, id) "
       "VALUES(?1, ?2, ?3, ?4, ?5, ?6)"},
      {&insert_single_,
       "INSERT INTO store_messages(session, category, type, payload, session_info, user_info, "
       "time, id) VALUES(NULL, ?1, ?2, ?3, ?4, ?5, ?6, ?7)"},
      {&insert_analytics_,
       "INSERT INTO store_analytics(name, message, host, payload, time, id) "
       "VALUES(?1, ?2, ?3, ?4, ?5, ?6)"},
      {&insert_powerlog_,
       "INSERT INTO store_powerlog(subsystem, name, payload, time, id) "
       "VALUES(?1, ?2, ?3, ?4, ?5)"},
      {&insert_link_,
       "INSERT INTO store_links(first_message, last_message, first_event, last_event) "
       "VALUES(?1, ?2, ?3, ?4)"},
      {&raise_sequence_,
       "UPDATE store_sequences SET last_id = ?2 WHERE name = ?1 AND last_id < ?2"},
  };
  for (auto& s : statements) {
    sqlite3_stmt* stmt = nullptr;
    int rc = sqlite3_prepare_v3(db_.get(), s.sql, -1, SQLITE_PREPARE_PERSISTENT, &stmt, nullptr);
    if (rc != SQLITE_OK) return SqliteError(db_.get(), rc, std::string("prepare ") + s.sql);
    s.stmt->reset(stmt);
  }
  for (int table = kMessages; table < kTables; ++table) {
    const std::string sql = std::string("SELECT max(IFNULL((SELECT max(id) FROM ") +
                            kTableNames[table] +
                            "), 0), IFNULL((SELECT last_id FROM store_sequences WHERE name = '" +
                            kTableNames[table] + "'), 0))";
    if (auto e = store::QueryInt(db_.get(), sql.c_str(), &next_ids_[table])) return e;
    ++next_ids_[table];
  }
  const std::string path = sqlite3_db_filename(db_.get(), "main");
  store::RetentionLimits limits;
  limits.max_bytes = options_.max_bytes.value_or(
      store::DefaultMaxBytes(path.substr(0, path.find_last_of('/') + 1) + "."));
  limits.max_age_seconds = options_.max_age_seconds;
  auto retention = std::make_unique<store::Retention>(db_.get(), log_, limits);
  if (auto e = retention->Prepare()) return e;
  retention_ = std::move(retention);
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

void ReportingStoreWriter::Start() {
  auto self = shared_from_this();
  thread_ = std::thread([self] { self->Run(); });
  writer_id_ = thread_.get_id();
}

// Hands `record` to the writer. A control record (flush, task) is taken even when the
// queue is full. Returns false when the record was not taken; a control record's
// callback is then the caller's to run.
bool ReportingStoreWriter::Push(Record&& record, bool control, std::int64_t* new_session_id) {
  record.bytes += record.payload.ApproximateBytes();
  if (record.bytes > 0) record.charged = HeldBytes::Charge::Current();
  std::unique_lock lock(mu_);
  // Taken under the lock: session ids then follow the queue's order, which is the
  // commit order.
  if (new_session_id) record.id = *new_session_id = NewSessionId();
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
  if (queue_.back().charged) {
    queue_.back().charged->Add(HeldBytes::kStore, static_cast<std::int64_t>(queue_.back().bytes));
  }
  const bool wake = writer_idle_ || (gathering_ && queue_.size() == kGatherRecords);
  writer_idle_ = false;
  lock.unlock();
  if (wake) wake_.notify_one();
  return true;
}

void ReportingStoreWriter::Drain() {
  if (std::this_thread::get_id() == writer_id_) return;
  std::unique_lock lock(mu_);
  const std::uint64_t target = stats_.handed_over;
  ++drains_waiting_;  // the writer does not gather while someone waits
  wake_.notify_one();
  written_cv_.wait(lock, [&] { return written_ >= target || exited_; });
  --drains_waiting_;
}

void ReportingStoreWriter::Shutdown() {
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

ReportingStore::Stats ReportingStoreWriter::stats() const {
  std::lock_guard lock(mu_);
  return stats_;
}

void ReportingStoreWriter::SetAfterBatch(std::function<void()> callback) {
  std::lock_guard lock(mu_);
  after_batch_ = std::move(callback);
}

bool ReportingStoreWriter::open() const {
  std::lock_guard lock(mu_);
  return !closing_;
}

void ReportingStoreWriter::Run() {
  if (auto e = Ready()) {
    failing_rc_ = static_cast<int>(e->code);
    QN_STORE_ERROR("%s:%d:%s: reporting store: %s; records are lost until it works",
                   e->description);
  }
  RunRetention();
  std::vector<Record> batch;
  for (;;) {
    std::uint64_t dropped = 0;
    std::uint64_t batch_end = 0;
    {
      std::unique_lock lock(mu_);
      // While idle, retention goes on (step by step) when it has more to do, and looks
      // again once a second.
      while (queue_.empty() && !closing_) {
        if (retention_busy_) {
          lock.unlock();
          RunRetention();
          lock.lock();
          continue;
        }
        writer_idle_ = true;
        if (wake_.wait_for(lock, kRetentionInterval) == std::cv_status::timeout) {
          writer_idle_ = false;
          lock.unlock();
          RunRetention();
          lock.lock();
        }
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
    for (const Record& r : batch) {
      bytes += r.bytes;
      if (r.charged) r.charged->Add(HeldBytes::kStore, -static_cast<std::int64_t>(r.bytes));
    }
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
    RunRetention();
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

void ReportingStoreWriter::RunRetention() {
  if (!retention_) return;  // not ready
  const double now =
      std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
  retention_busy_ = retention_->Run(now);
  const store::RetentionStats& figures = retention_->stats();
  std::lock_guard lock(mu_);
  stats_.retention_removed = figures.removed;
  stats_.retention_lost = figures.lost;
  stats_.bytes_on_disk = figures.bytes_on_disk;
  stats_.oldest_row_time = figures.oldest_time;
}

void ReportingStoreWriter::FinishCheckpoint() {
  if (wal_pages_ < 2 * kWrapPages && !checkpointer_->Idle()) return;
  checkpointer_->Yield();
  int wal_frames = 0;
  int copied = 0;
  const int rc = sqlite3_wal_checkpoint_v2(db_.get(), nullptr, SQLITE_CHECKPOINT_PASSIVE,
                                           &wal_frames, &copied);
  if (rc == SQLITE_OK && copied == wal_frames) wal_pages_ = 0;
}

void ReportingStoreWriter::CloseDatabase() {
  // Its connection goes first, so that closing the writer's (the last one) checkpoints
  // everything and removes the WAL file.
  sqlite3_wal_hook(db_.get(), nullptr, nullptr);
  checkpointer_.reset();
  for (Statement* s : {&begin_, &commit_, &rollback_, &insert_session_, &flush_session_,
                       &set_last_message_, &raise_sequence_, &insert_link_, &insert_message_,
                       &insert_single_, &insert_analytics_, &insert_powerlog_}) {
    s->reset();
  }
  retention_.reset();  // its statements
  int rc = sqlite3_close(db_.get());
  if (rc != SQLITE_OK) {
    QN_STORE_ERROR("%s:%d:%s: reporting store: closing the database failed: %s (%d)",
                   sqlite3_errmsg(db_.get()), rc);
    return;  // the handle's deleter retries with sqlite3_close_v2
  }
  (void)db_.release();
}

std::optional<Error> ReportingStoreWriter::WriteBatch(std::vector<Record>& batch) {
  const auto all = std::span<Record>(batch);
  if (auto e = Ready()) return LoseAll(all, Failure{static_cast<int>(e->code), e->description, *e});
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
    QN_STORE_ERROR("%s:%d:%s: reporting store: dropped a %s record that cannot be written: %s (%d)",
                   KindName(batch[i].kind), failure->message, failure->rc);
    last = failure->error;
  }
  return last;
}

std::optional<ReportingStoreWriter::Failure> ReportingStoreWriter::WriteTransaction(
    std::span<Record> records) {
  int rc = Step(begin_.get());
  if (rc != SQLITE_DONE) return Fail(rc, "begin");
  session_last_message_.clear();
  link_ = Link{};
  std::fill(std::begin(written_ids_), std::end(written_ids_), 0);
  // Analytics events after the rest: one that repeats a message of the same batch (handed
  // over before it, as the message waits for its session's queue) then finds its row. Ids
  // still follow hand-over within each table.
  for (const bool analytics : {false, true}) {
    for (Record& record : records) {
      if ((record.kind == RecordKind::kAnalytics) != analytics) continue;
      rc = WriteRecord(record);
      if (rc != SQLITE_DONE) {
        recent_messages_.RolledBack();
        return Fail(rc, "insert");
      }
    }
  }
  for (const auto& [session, last] : session_last_message_) {
    sqlite3_bind_int64(set_last_message_.get(), 1, session);
    sqlite3_bind_int64(set_last_message_.get(), 2, last);
    rc = Step(set_last_message_.get());
    if (rc != SQLITE_DONE) {
      recent_messages_.RolledBack();
      return Fail(rc, "update");
    }
  }
  session_last_message_.clear();
  if (link_.first_message != 0) {
    sqlite3_stmt* insert = insert_link_.get();
    sqlite3_bind_int64(insert, 1, link_.first_message);
    sqlite3_bind_int64(insert, 2, link_.last_message);
    sqlite3_bind_int64(insert, 3, link_.first_event);
    sqlite3_bind_int64(insert, 4, link_.last_event);
    rc = Step(insert);
    if (rc != SQLITE_DONE) {
      recent_messages_.RolledBack();
      return Fail(rc, "insert");
    }
  }
  for (int table = 0; table < kTables; ++table) {
    if (written_ids_[table] == 0) continue;
    sqlite3_bind_text(raise_sequence_.get(), 1, kTableNames[table], -1, SQLITE_STATIC);
    sqlite3_bind_int64(raise_sequence_.get(), 2, written_ids_[table]);
    rc = Step(raise_sequence_.get());
    if (rc != SQLITE_DONE) {
      recent_messages_.RolledBack();
      return Fail(rc, "update");
    }
  }
  rc = Step(commit_.get());
  if (rc != SQLITE_DONE) {
    recent_messages_.RolledBack();
    return Fail(rc, "commit");
  }
  recent_messages_.Committed();
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

ReportingStoreWriter::Failure ReportingStoreWriter::Fail(int rc, const char* step) {
  sqlite3* db = db_.get();
  Failure failure{rc, sqlite3_errmsg(db),
                  SqliteError(db, rc, std::string("reporting store ") + step)};
  failure.message = std::string(step) + " failed: " + failure.message;
  if (!sqlite3_get_autocommit(db)) Step(rollback_.get());
  return failure;
}

std::optional<Error> ReportingStoreWriter::LoseAll(std::span<Record> records,
                                                   const Failure& failure) {
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

void ReportingStoreWriter::BindJson(sqlite3_stmt* stmt, int index, std::string& buffer,
                                    const Value& value) {
  buffer.clear();
  AppendJsonLenient(buffer, value);
  BindText(stmt, index, buffer);
}

std::int64_t ReportingStoreWriter::TakeId(Table table) {
  written_ids_[table] = next_ids_[table]++;
  return written_ids_[table];
}

void ReportingStoreWriter::BindText(sqlite3_stmt* stmt, int index, const std::string& text) {
  sqlite3_bind_text(stmt, index, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
}

int ReportingStoreWriter::WriteRecord(Record& r) {
  sqlite3_stmt* stmt = nullptr;
  std::int64_t row = 0;
  switch (r.kind) {
    case RecordKind::kSessionMessage:
      stmt = insert_message_.get();
      sqlite3_bind_int64(stmt, 1, r.id);
      sqlite3_bind_int(stmt, 2, r.category);
      sqlite3_bind_int(stmt, 3, r.type);
      BindJson(stmt, 4, json_payload_, r.payload);
      sqlite3_bind_double(stmt, 5, r.time);
      sqlite3_bind_int64(stmt, 6, row = TakeId(kMessages));
      break;
    case RecordKind::kSingleMessage:
      stmt = insert_single_.get();
      sqlite3_bind_int(stmt, 1, r.category);
      sqlite3_bind_int(stmt, 2, r.type);
      BindJson(stmt, 3, json_payload_, r.payload);
      BindJson(stmt, 4, json_session_info_, r.extra->session_info);
      BindJson(stmt, 5, json_user_info_, r.extra->user_info);
      sqlite3_bind_double(stmt, 6, r.time);
      sqlite3_bind_int64(stmt, 7, row = TakeId(kMessages));
      break;
    case RecordKind::kSession:
      stmt = insert_session_.get();
      sqlite3_bind_int64(stmt, 1, r.id);
      BindJson(stmt, 2, json_session_info_, r.extra->session_info);
      BindJson(stmt, 3, json_user_info_, r.extra->user_info);
      sqlite3_bind_double(stmt, 4, r.time);
      written_ids_[kSessions] = std::max(written_ids_[kSessions], r.id);
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
      const std::int64_t event = TakeId(kAnalytics);
      if (auto repeat = recent_messages_.Find(r.payload)) {
        link_.Add(repeat->message, event);
        sqlite3_bind_int64(stmt, 2, repeat->message);
        sqlite3_bind_text(stmt, 3, repeat->host.data(), static_cast<int>(repeat->host.size()),
                          SQLITE_TRANSIENT);
        sqlite3_bind_null(stmt, 4);
      } else {
        sqlite3_bind_null(stmt, 2);
        sqlite3_bind_null(stmt, 3);
        BindJson(stmt, 4, json_payload_, r.payload);
      }
      sqlite3_bind_double(stmt, 5, r.time);
      sqlite3_bind_int64(stmt, 6, event);
      break;
    }
    case RecordKind::kPowerLog:
      stmt = insert_powerlog_.get();
      sqlite3_bind_int(stmt, 1, r.subsystem);
      BindText(stmt, 2, r.extra->name);
      BindJson(stmt, 3, json_payload_, r.payload);
      sqlite3_bind_double(stmt, 4, r.time);
      sqlite3_bind_int64(stmt, 5, TakeId(kPowerLog));
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
  const int rc = Step(stmt);
  if (rc == SQLITE_DONE &&
      (r.kind == RecordKind::kSessionMessage || r.kind == RecordKind::kSingleMessage)) {
    recent_messages_.Add(row, r.payload);
    if (r.kind == RecordKind::kSessionMessage) session_last_message_[r.id] = row;
  }
  return rc;
}

Value ReportingStoreWriter::CallProvider(const std::function<Value()>& provider,
                                         const std::string& name) {
  try {
    return provider();
  } catch (const std::exception& e) {
    QN_STORE_ERROR("%s:%d:%s: reporting store: payload provider of %s threw: %s", name, e.what());
  } catch (...) {
    QN_STORE_ERROR("%s:%d:%s: reporting store: payload provider of %s threw", name);
  }
  return Value();
}

void ReportingStoreWriter::RunCallbacks(std::vector<Record>& batch,
                                        const std::optional<Error>& error) {
  for (Record& r : batch) {
    if (r.kind == RecordKind::kFlush && r.extra && r.extra->flushed) {
      r.extra->flushed(r.failed ? error : std::nullopt);
    } else if (r.kind == RecordKind::kTask && r.extra && r.extra->task) {
      r.extra->task();
    }
  }
}

void ReportingStoreWriter::LogQueueFull(std::uint64_t dropped) {
  QN_STORE_ERROR("%s:%d:%s: reporting store: queue full (%llu records), dropped %llu records",
                 static_cast<unsigned long long>(options_.max_queued_records),
                 static_cast<unsigned long long>(dropped));
}

}  // namespace qn
