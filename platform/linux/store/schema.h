#pragma once

#include <sqlite3.h>

#include <optional>
#include <string>

#include "common/Error.h"
#include "platform/log.h"

// The store's schema: its versions and the steps from each to the next.
//
// Version 2 (this program's) keeps one row per delivered message:
//   store_sessions(id, session_info, user_info, created, flushed, last_message)
//       last_message: the newest message row of the session (NULL: none yet), written
//       once per transaction; retention keeps the session while that row remains.
//   store_messages(id, session NULL, category, type, payload, session_info NULL,
//                  user_info NULL, time)
//   store_analytics(id, name, message NULL, host NULL, payload NULL, time)
//       an event that repeats a message refers to its row (`message`) and keeps only the
//       HostApplicationDisplayID it adds (`host`); any other event keeps its `payload`.
//   store_powerlog(id, subsystem, name, payload, time)
//   export_cursors(exporter, kind, last_id): how far each exporter got per kind
//       ('sessions', 'messages', 'analytics', 'powerlog'), written by the exporter.
//   store_sequences(name, last_id): the highest id each table ever had. The writer
//       assigns ids itself (one writer: they grow in commit order) and raises these once
//       per transaction, so that an id is never reused, also after retention emptied a
//       table (AUTOINCREMENT would do the same at a cost on every insert). Readers see the
// version 1 shapes through views of the version 1 table names (livo_sessions,
// livo_messages, analytics_events, powerlog_events); reporting_store_reader.h lists them.
// The file uses incremental auto-vacuum, so that retention can give pages back.
namespace qn::store {

inline constexpr int kSchemaVersion = 2;

// Reads the version of the open database `db` into *version. Fails, leaving the file
// untouched, when it is newer than kSchemaVersion.
std::optional<Error> CheckSchemaVersion(sqlite3* db, const std::string& path, int* version);

// Brings `db` to kSchemaVersion: every step from its version on, one function per step, in
// one transaction that also writes the version, so that the file is either as it was or
// fully migrated. A new (empty) file gets incremental auto-vacuum first. Each step's work
// is logged at the default level through `log` (may be null). Returns the error of a
// failed step (the transaction is rolled back).
std::optional<Error> MigrateSchema(sqlite3* db, const std::string& path, Log* log);

// Turns incremental auto-vacuum on for a file made without it (one VACUUM, a copy of the
// file, logged); does nothing when it is on. A failure (a reader in the way, no room for
// the copy) is logged at error level: the file then keeps its free pages, and the next
// start tries again.
void EnsureIncrementalVacuum(sqlite3* db, const std::string& path, Log* log);

}  // namespace qn::store
