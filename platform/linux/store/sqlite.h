#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "common/Error.h"

// Small SQLite helpers shared by the store's parts (schema, writer, checkpointer, retention).
namespace qn::store {

struct DbCloser {
  void operator()(sqlite3* db) const { sqlite3_close_v2(db); }
};
struct StmtFinalizer {
  void operator()(sqlite3_stmt* stmt) const { sqlite3_finalize(stmt); }
};
using DbHandle = std::unique_ptr<sqlite3, DbCloser>;
using Statement = std::unique_ptr<sqlite3_stmt, StmtFinalizer>;

// An error of the store's domain with SQLite's message for `db` (or for `rc` without one).
Error SqliteError(sqlite3* db, int rc, const std::string& what);

// Runs `sql` (statements that return no rows). Returns the error, "what: message".
std::optional<Error> Exec(sqlite3* db, const char* sql, const std::string& what);

// The first column of the first row of `sql` as an integer; *out is left alone when the
// query returns no row.
std::optional<Error> QueryInt(sqlite3* db, const char* sql, std::int64_t* out);

// Prepares `sql` for repeated use into *out.
std::optional<Error> Prepare(sqlite3* db, const char* sql, Statement* out);

// Runs a statement that returns no rows and resets it. Returns SQLite's result code.
int Step(sqlite3_stmt* stmt);

}  // namespace qn::store
