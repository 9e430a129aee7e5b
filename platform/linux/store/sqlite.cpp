#include "platform/linux/store/sqlite.h"

#include "platform/linux/reporting_store.h"

namespace qn::store {

Error SqliteError(sqlite3* db, int rc, const std::string& what) {
  std::string message = db ? sqlite3_errmsg(db) : sqlite3_errstr(rc);
  return Error{kReportingStoreErrorDomain, rc, what + ": " + message};
}

std::optional<Error> Exec(sqlite3* db, const char* sql, const std::string& what) {
  char* message = nullptr;
  int rc = sqlite3_exec(db, sql, nullptr, nullptr, &message);
  if (rc == SQLITE_OK) return std::nullopt;
  Error error{kReportingStoreErrorDomain, rc,
              what + ": " + (message ? message : sqlite3_errstr(rc))};
  sqlite3_free(message);
  return error;
}

std::optional<Error> QueryInt(sqlite3* db, const char* sql, std::int64_t* out) {
  Statement stmt;
  if (auto e = Prepare(db, sql, &stmt)) return e;
  const int rc = sqlite3_step(stmt.get());
  if (rc == SQLITE_ROW) {
    *out = sqlite3_column_int64(stmt.get(), 0);
    return std::nullopt;
  }
  if (rc == SQLITE_DONE) return std::nullopt;
  return SqliteError(db, rc, sql);
}

std::optional<Error> Prepare(sqlite3* db, const char* sql, Statement* out) {
  sqlite3_stmt* stmt = nullptr;
  const int rc = sqlite3_prepare_v3(db, sql, -1, SQLITE_PREPARE_PERSISTENT, &stmt, nullptr);
  out->reset(stmt);
  if (rc != SQLITE_OK) return SqliteError(db, rc, std::string("prepare ") + sql);
  return std::nullopt;
}

int Step(sqlite3_stmt* stmt) {
  const int rc = sqlite3_step(stmt);
  sqlite3_reset(stmt);
  return rc;
}

}  // namespace qn::store
