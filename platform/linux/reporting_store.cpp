#include "platform/linux/reporting_store.h"

#include <sqlite3.h>
#include <time.h>

#include <cstdlib>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/store/schema.h"
#include "platform/linux/store/sqlite.h"
#include "platform/linux/store/writer.h"

namespace qn {
namespace {

double WallNow() {
  timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
}

using store::DbHandle;
using store::Exec;
using store::QueryInt;
using store::SqliteError;
using store::Statement;
using store::Step;

// Runs `task` on a short-lived thread of its own: for callbacks that must not run on the
// caller's stack when the writer thread is gone.
void RunDetached(std::function<void()> task) { std::thread(std::move(task)).detach(); }

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

// Opens the database, sets the journal and checks the schema's version (a newer one than
// this program's is refused). Returns the first free session id through
// *next_session_id and the version through *schema_version.
std::optional<Error> OpenDatabase(const std::string& path, const ReportingStore::Options& options,
                                  DbHandle* out, std::int64_t* next_session_id,
                                  int* schema_version) {
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

  int version = 0;
  if (auto e = store::CheckSchemaVersion(db.get(), path, &version)) return e;
  // Session ids are ours (NewSessionId): above every id in the table and every id it
  // ever had (its sequence), so that none is reused.
  const char* max_id_sql =
      version >= 2
          ? "SELECT max(IFNULL((SELECT max(id) FROM store_sessions), 0), "
            "IFNULL((SELECT last_id FROM store_sequences WHERE name = 'store_sessions'), 0))"
      : version == 1 ? "SELECT IFNULL(max(id), 0) FROM livo_sessions"
                     : "SELECT 0";
  std::int64_t max_id = 0;
  if (auto e = QueryInt(db.get(), max_id_sql, &max_id)) return e;
  *schema_version = version;
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
  int version = 0;
  std::optional<Error> failure = OpenDatabase(path, options, &db, &next_session_id, &version);
  std::shared_ptr<ReportingStoreWriter> writer;
  if (!failure) {
    writer = std::make_shared<ReportingStoreWriter>(std::move(db), std::move(log), options,
                                                    next_session_id);
    // A new file gets its schema at once; an older one is migrated by the writer thread,
    // which takes records meanwhile.
    if (version == 0 || version == store::kSchemaVersion) failure = writer->Ready();
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

std::int64_t ReportingStore::AddNewSession(Value session_info, Value user_info) {
  Record r = MakeRecord(RecordKind::kSession);
  r.extra = std::make_unique<RecordExtra>();
  r.extra->session_info = std::move(session_info);
  r.extra->user_info = std::move(user_info);
  std::int64_t id = 0;
  writer_->Push(std::move(r), false, &id);
  return id;
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

bool ReportingStore::AddAnalyticsEvent(std::string name, std::function<Value()> provider,
                                       std::size_t held_bytes) {
  Record r = MakeRecord(RecordKind::kAnalytics);
  r.bytes = held_bytes;
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
