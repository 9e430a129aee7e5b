#include "platform/linux/reporting_store_reader.h"

#include <sqlite3.h>

#include <array>
#include <utility>
#include <vector>

#include "platform/linux/reporting_store.h"

namespace qn {
namespace {

using Table = ReportingStoreRow::Table;

constexpr int kBusyTimeoutMs = 5000;

struct StmtFinalizer {
  void operator()(sqlite3_stmt* stmt) const { sqlite3_finalize(stmt); }
};
using Statement = std::unique_ptr<sqlite3_stmt, StmtFinalizer>;

Error ReadError(sqlite3* db, int rc, const std::string& what) {
  return Error{kReportingStoreErrorDomain, rc,
               what + ": " + (db ? sqlite3_errmsg(db) : sqlite3_errstr(rc))};
}

// The query of each table, in Table order. Columns are read by ReadRow; the parameters are
// ?1 the last id seen, ?2 the earliest time, ?3 the framework session (NULL: any).
constexpr std::array<const char*, 4> kQueries = {
    "SELECT id, created, flushed, session_info, user_info FROM livo_sessions "
    "WHERE id > ?1 AND created >= ?2 AND (?3 IS NULL OR id = ?3) ORDER BY id",
    "SELECT id, time, session, category, type, payload, session_info, user_info "
    "FROM livo_messages WHERE id > ?1 AND time >= ?2 AND (?3 IS NULL OR session = ?3) "
    "ORDER BY id",
    "SELECT id, time, name, payload FROM analytics_events "
    "WHERE id > ?1 AND time >= ?2 AND ?3 IS NULL ORDER BY id",
    "SELECT id, time, subsystem, name, payload FROM powerlog_events "
    "WHERE id > ?1 AND time >= ?2 AND ?3 IS NULL ORDER BY id",
};

std::string Text(sqlite3_stmt* stmt, int column) {
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(stmt, column));
  if (!text) return std::string();
  return std::string(text, static_cast<std::size_t>(sqlite3_column_bytes(stmt, column)));
}

ReportingStoreRow ReadRow(Table table, sqlite3_stmt* stmt) {
  ReportingStoreRow row;
  row.table = table;
  row.id = sqlite3_column_int64(stmt, 0);
  row.time = sqlite3_column_double(stmt, 1);
  switch (table) {
    case Table::kLivoSession:
      if (sqlite3_column_type(stmt, 2) != SQLITE_NULL) row.flushed = sqlite3_column_double(stmt, 2);
      row.session_info = Text(stmt, 3);
      row.user_info = Text(stmt, 4);
      break;
    case Table::kLivoMessage:
      if (sqlite3_column_type(stmt, 2) != SQLITE_NULL) row.session = sqlite3_column_int64(stmt, 2);
      row.category = sqlite3_column_int64(stmt, 3);
      row.type = sqlite3_column_int64(stmt, 4);
      row.payload = Text(stmt, 5);
      row.session_info = Text(stmt, 6);
      row.user_info = Text(stmt, 7);
      break;
    case Table::kAnalyticsEvent:
      row.name = Text(stmt, 2);
      row.payload = Text(stmt, 3);
      break;
    case Table::kPowerLogEvent:
      row.subsystem = sqlite3_column_int64(stmt, 2);
      row.name = Text(stmt, 3);
      row.payload = Text(stmt, 4);
      break;
  }
  return row;
}

bool SinkHasTable(ReportingSink sink, Table table) {
  switch (sink) {
    case ReportingSink::kReporting:
      return table == Table::kLivoSession || table == Table::kLivoMessage;
    case ReportingSink::kAnalytics:
      return table == Table::kAnalyticsEvent;
    case ReportingSink::kPowerLog:
      return table == Table::kPowerLogEvent;
  }
  return false;
}

// One table's rows in id order, one row ahead.
struct Cursor {
  Table table;
  Statement stmt;
  std::optional<ReportingStoreRow> current;
};

}  // namespace

const char* ReportingSinkName(ReportingSink sink) {
  switch (sink) {
    case ReportingSink::kReporting:
      return "reporting";
    case ReportingSink::kAnalytics:
      return "analytics";
    case ReportingSink::kPowerLog:
      return "powerlog";
  }
  return "reporting";
}

std::optional<ReportingSink> ParseReportingSink(std::string_view name) {
  for (ReportingSink sink :
       {ReportingSink::kReporting, ReportingSink::kAnalytics, ReportingSink::kPowerLog}) {
    if (name == ReportingSinkName(sink)) return sink;
  }
  return std::nullopt;
}

ReportingSink ReportingStoreRow::sink() const {
  switch (table) {
    case Table::kLivoSession:
    case Table::kLivoMessage:
      return ReportingSink::kReporting;
    case Table::kAnalyticsEvent:
      return ReportingSink::kAnalytics;
    case Table::kPowerLogEvent:
      return ReportingSink::kPowerLog;
  }
  return ReportingSink::kReporting;
}

const char* ReportingStoreRow::table_name() const {
  switch (table) {
    case Table::kLivoSession:
      return "livo_sessions";
    case Table::kLivoMessage:
      return "livo_messages";
    case Table::kAnalyticsEvent:
      return "analytics_events";
    case Table::kPowerLogEvent:
      return "powerlog_events";
  }
  return "livo_messages";
}

void ReportingRowFilter::Advance(const ReportingStoreRow& row) {
  std::int64_t& last = after[static_cast<std::size_t>(row.table)];
  if (row.id > last) last = row.id;
}

void ReportingStoreReader::Closer::operator()(sqlite3* db) const { sqlite3_close_v2(db); }

ReportingStoreReader::ReportingStoreReader(Connection db) : db_(std::move(db)) {}

std::unique_ptr<ReportingStoreReader> ReportingStoreReader::Open(const std::string& path,
                                                                 std::optional<Error>* error) {
  sqlite3* raw = nullptr;
  int rc = sqlite3_open_v2(path.c_str(), &raw, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOMUTEX, nullptr);
  Connection db(raw);
  if (rc == SQLITE_OK) {
    // The writer holds the database exclusively for a moment while it closes (its final
    // checkpoint); wait for that rather than failing.
    sqlite3_busy_timeout(db.get(), kBusyTimeoutMs);
    // Fails here rather than at the first query when the file is not a store.
    rc = sqlite3_exec(db.get(), "SELECT 1 FROM livo_sessions LIMIT 0", nullptr, nullptr, nullptr);
  }
  if (rc != SQLITE_OK) {
    if (error) *error = ReadError(db.get(), rc, "open " + path);
    return nullptr;
  }
  return std::make_unique<ReportingStoreReader>(std::move(db));
}

std::optional<Error> ReportingStoreReader::ForEachRow(const ReportingRowFilter& filter,
                                                      const Visitor& visit) {
  sqlite3* db = db_.get();
  // One read transaction: every table is read from the same snapshot.
  int rc = sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) return ReadError(db, rc, "begin");
  struct EndRead {
    sqlite3* db;
    ~EndRead() { sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr); }
  } end_read{db};

  std::vector<Cursor> cursors;
  for (Table table :
       {Table::kLivoSession, Table::kLivoMessage, Table::kAnalyticsEvent, Table::kPowerLogEvent}) {
    if (filter.sink && !SinkHasTable(*filter.sink, table)) continue;
    sqlite3_stmt* raw = nullptr;
    rc = sqlite3_prepare_v2(db, kQueries[static_cast<std::size_t>(table)], -1, &raw, nullptr);
    Statement stmt(raw);
    if (rc != SQLITE_OK) return ReadError(db, rc, "query");
    sqlite3_bind_int64(raw, 1, filter.after[static_cast<std::size_t>(table)]);
    sqlite3_bind_double(raw, 2, filter.since.value_or(-1e300));
    if (filter.session) sqlite3_bind_int64(raw, 3, *filter.session);
    cursors.push_back(Cursor{table, std::move(stmt), std::nullopt});
  }

  // Moves a cursor to its next row; returns the error when the step failed.
  auto advance = [db](Cursor& cursor) -> std::optional<Error> {
    int step = sqlite3_step(cursor.stmt.get());
    if (step == SQLITE_ROW) {
      cursor.current = ReadRow(cursor.table, cursor.stmt.get());
      return std::nullopt;
    }
    cursor.current.reset();
    if (step == SQLITE_DONE) return std::nullopt;
    return ReadError(db, step, "read");
  };

  for (Cursor& cursor : cursors) {
    if (auto e = advance(cursor)) return e;
  }
  for (;;) {
    Cursor* next = nullptr;
    for (Cursor& cursor : cursors) {
      if (!cursor.current) continue;
      // Cursors are in Table order, so a strict comparison keeps earlier tables first at
      // equal times.
      if (!next || cursor.current->time < next->current->time) next = &cursor;
    }
    if (!next) return std::nullopt;
    if (!visit(*next->current)) return std::nullopt;
    if (auto e = advance(*next)) return e;
  }
}

}  // namespace qn
