#include "platform/linux/export/export_source.h"

#include <sqlite3.h>

#include <initializer_list>
#include <utility>

#include "common/Json.h"
#include "common/Value.h"
#include "platform/linux/reporting_store.h"

namespace qn {
namespace {

constexpr int kBusyTimeoutMs = 2000;

// How a column is written into the body.
enum class Column { kInteger, kReal, kText, kJson };
struct ColumnOf {
  const char* name;
  Column type;
};

// What each kind reads: its view, and the columns after `id` and the row's time (the
// first column listed is the time).
struct KindQuery {
  const char* view;
  std::initializer_list<ColumnOf> columns;
};
const KindQuery kQueries[kExportKinds] = {
    {"livo_sessions",
     {{"created", Column::kReal},
      {"flushed", Column::kReal},
      {"session_info", Column::kJson},
      {"user_info", Column::kJson}}},
    {"livo_messages",
     {{"time", Column::kReal},
      {"session", Column::kInteger},
      {"category", Column::kInteger},
      {"type", Column::kInteger},
      {"payload", Column::kJson},
      {"session_info", Column::kJson},
      {"user_info", Column::kJson}}},
    {"analytics_events",
     {{"time", Column::kReal}, {"name", Column::kText}, {"payload", Column::kJson}}},
    {"powerlog_events",
     {{"time", Column::kReal},
      {"subsystem", Column::kInteger},
      {"name", Column::kText},
      {"payload", Column::kJson}}},
};

std::string ColumnList(ExportKind kind) {
  std::string list = "id";
  for (const ColumnOf& column : kQueries[static_cast<int>(kind)].columns) {
    list += ", ";
    list += column.name;
  }
  return list;
}

std::string_view TextOf(sqlite3_stmt* stmt, int column) {
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(stmt, column));
  if (!text) return {};
  return {text, static_cast<std::size_t>(sqlite3_column_bytes(stmt, column))};
}

}  // namespace

const char* ExportKindName(ExportKind kind) {
  switch (kind) {
    case ExportKind::kSessions:
      return "sessions";
    case ExportKind::kMessages:
      return "messages";
    case ExportKind::kAnalytics:
      return "analytics";
    case ExportKind::kPowerLog:
      return "powerlog";
  }
  return "";
}

std::unique_ptr<ExportSource> ExportSource::Open(const std::string& path, std::string device,
                                                 std::optional<Error>* error) {
  sqlite3* db = nullptr;
  const int rc =
      sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  auto source = std::make_unique<ExportSource>(db, std::move(device));
  std::optional<Error> failure;
  if (rc != SQLITE_OK) failure = source->Failure("cannot open " + path);
  for (ExportKind kind : kAllExportKinds) {
    const std::string view = kQueries[static_cast<int>(kind)].view;
    const std::string read =
        "SELECT " + ColumnList(kind) + " FROM " + view + " WHERE id > ?1 ORDER BY id LIMIT ?2";
    const std::string lag = "SELECT count(*), (SELECT " +
                            std::string(kQueries[static_cast<int>(kind)].columns.begin()->name) +
                            " FROM " + view + " WHERE id > ?1 ORDER BY id LIMIT 1) FROM " + view +
                            " WHERE id > ?1";
    if (!failure) failure = source->Prepare(source->read_[static_cast<int>(kind)], read.c_str());
    if (!failure) failure = source->Prepare(source->lag_[static_cast<int>(kind)], lag.c_str());
  }
  const std::string session =
      "SELECT " + ColumnList(ExportKind::kSessions) + " FROM livo_sessions WHERE id = ?1";
  if (!failure) failure = source->Prepare(source->session_, session.c_str());
  if (!failure) {
    failure = source->Prepare(source->last_session_, "SELECT max(id) FROM livo_sessions");
  }
  if (!failure) {
    failure = source->Prepare(source->load_,
                              "SELECT kind, last_id FROM export_cursors WHERE exporter = ?1");
  }
  if (!failure) {
    failure =
        source->Prepare(source->save_,
                        "INSERT INTO export_cursors(exporter, kind, last_id) VALUES(?1, ?2, ?3) "
                        "ON CONFLICT(exporter, kind) DO UPDATE SET last_id = excluded.last_id");
  }
  if (failure) {
    if (error) *error = std::move(failure);
    return nullptr;
  }
  return source;
}

ExportSource::ExportSource(sqlite3* db, std::string device) : db_(db), device_(std::move(device)) {
  if (db_) sqlite3_busy_timeout(db_, kBusyTimeoutMs);
}

ExportSource::~ExportSource() {
  for (auto* group : {&read_, &lag_})
    for (Statement& stmt : *group) stmt.reset();
  for (Statement* stmt : {&session_, &last_session_, &load_, &save_}) stmt->reset();
  sqlite3_close(db_);
}

Error ExportSource::Failure(const std::string& what) const {
  return Error{kReportingStoreErrorDomain, db_ ? sqlite3_errcode(db_) : SQLITE_NOMEM,
               what + ": " + (db_ ? sqlite3_errmsg(db_) : "out of memory")};
}

std::optional<Error> ExportSource::Prepare(Statement& stmt, const char* sql) {
  sqlite3_stmt* raw = nullptr;
  if (sqlite3_prepare_v3(db_, sql, -1, SQLITE_PREPARE_PERSISTENT, &raw, nullptr) != SQLITE_OK) {
    return Failure("the store cannot be exported");
  }
  stmt.reset(raw);
  return std::nullopt;
}

void ExportSource::AppendBody(ExportKind kind, sqlite3_stmt* stmt, ExportRow& row) {
  row.id = sqlite3_column_int64(stmt, 0);
  row.time = sqlite3_column_double(stmt, 1);
  row.flushed = kind != ExportKind::kSessions || sqlite3_column_type(stmt, 2) != SQLITE_NULL;
  std::string& body = row.body;
  body = "{\"device\":";
  AppendJsonLenient(body, Value(device_));
  body += ",\"kind\":\"";
  body += ExportKindName(kind);
  body += "\",\"id\":";
  body += std::to_string(row.id);
  body += ",\"time\":";
  AppendJsonLenient(body, Value(row.time));
  int index = 1;
  for (const ColumnOf& column : kQueries[static_cast<int>(kind)].columns) {
    const int at = index++;
    if (column.type == Column::kReal && at == 1 && kind != ExportKind::kSessions) continue;
    body += ",\"";
    body += column.name;
    body += "\":";
    if (sqlite3_column_type(stmt, at) == SQLITE_NULL) {
      body += "null";
      continue;
    }
    switch (column.type) {
      case Column::kInteger:
        body += std::to_string(sqlite3_column_int64(stmt, at));
        break;
      case Column::kReal:
        AppendJsonLenient(body, Value(sqlite3_column_double(stmt, at)));
        break;
      case Column::kText:
        AppendJsonLenient(body, Value(std::string(TextOf(stmt, at))));
        break;
      case Column::kJson: {
        // The store writes these columns as compact JSON; an empty one is null.
        const std::string_view json = TextOf(stmt, at);
        body += json.empty() ? std::string_view("null") : json;
        break;
      }
    }
  }
  body += '}';
}

std::optional<Error> ExportSource::Read(ExportKind kind, std::int64_t after, int limit,
                                        std::vector<ExportRow>& out) {
  sqlite3_stmt* stmt = read_[static_cast<int>(kind)].get();
  sqlite3_bind_int64(stmt, 1, after);
  sqlite3_bind_int(stmt, 2, limit);
  int rc;
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) AppendBody(kind, stmt, out.emplace_back());
  sqlite3_reset(stmt);
  if (rc != SQLITE_DONE) return Failure(std::string("cannot read ") + ExportKindName(kind));
  return std::nullopt;
}

std::optional<ExportRow> ExportSource::ReadSession(std::int64_t id, std::optional<Error>* error) {
  sqlite3_stmt* stmt = session_.get();
  sqlite3_bind_int64(stmt, 1, id);
  std::optional<ExportRow> row;
  const int rc = sqlite3_step(stmt);
  if (rc == SQLITE_ROW) AppendBody(ExportKind::kSessions, stmt, row.emplace());
  if (rc != SQLITE_ROW && rc != SQLITE_DONE && error) *error = Failure("cannot read sessions");
  sqlite3_reset(stmt);
  return row;
}

std::int64_t ExportSource::LastSessionId() {
  std::int64_t id = 0;
  if (sqlite3_step(last_session_.get()) == SQLITE_ROW) {
    id = sqlite3_column_int64(last_session_.get(), 0);
  }
  sqlite3_reset(last_session_.get());
  return id;
}

std::optional<Error> ExportSource::LoadCursors(const std::string& exporter,
                                               std::array<std::int64_t, kExportKinds>& cursors) {
  cursors.fill(0);
  sqlite3_stmt* stmt = load_.get();
  sqlite3_bind_text(stmt, 1, exporter.c_str(), -1, SQLITE_TRANSIENT);
  int rc;
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
    const std::string_view kind = TextOf(stmt, 0);
    for (ExportKind k : kAllExportKinds) {
      if (kind == ExportKindName(k)) cursors[static_cast<int>(k)] = sqlite3_column_int64(stmt, 1);
    }
  }
  sqlite3_reset(stmt);
  if (rc != SQLITE_DONE) return Failure("cannot read the export cursors");
  return std::nullopt;
}

std::optional<Error> ExportSource::SaveCursors(
    const std::string& exporter, const std::array<std::int64_t, kExportKinds>& cursors) {
  if (sqlite3_exec(db_, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr) != SQLITE_OK) {
    return Failure("cannot save the export cursors");
  }
  sqlite3_stmt* stmt = save_.get();
  int rc = SQLITE_DONE;
  for (ExportKind kind : kAllExportKinds) {
    sqlite3_bind_text(stmt, 1, exporter.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_text(stmt, 2, ExportKindName(kind), -1, SQLITE_STATIC);
    sqlite3_bind_int64(stmt, 3, cursors[static_cast<int>(kind)]);
    rc = sqlite3_step(stmt);
    sqlite3_reset(stmt);
    if (rc != SQLITE_DONE) break;
  }
  if (rc == SQLITE_DONE && sqlite3_exec(db_, "COMMIT", nullptr, nullptr, nullptr) == SQLITE_OK) {
    return std::nullopt;
  }
  Error failure = Failure("cannot save the export cursors");
  sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
  return failure;
}

std::optional<Error> ExportSource::Lag(ExportKind kind, std::int64_t after, ExportLag& out) {
  sqlite3_stmt* stmt = lag_[static_cast<int>(kind)].get();
  sqlite3_bind_int64(stmt, 1, after);
  const int rc = sqlite3_step(stmt);
  if (rc == SQLITE_ROW) {
    out.rows = sqlite3_column_int64(stmt, 0);
    out.oldest_time.reset();
    if (sqlite3_column_type(stmt, 1) != SQLITE_NULL)
      out.oldest_time = sqlite3_column_double(stmt, 1);
  }
  sqlite3_reset(stmt);
  if (rc != SQLITE_ROW) return Failure("cannot count the rows to export");
  return std::nullopt;
}

}  // namespace qn
