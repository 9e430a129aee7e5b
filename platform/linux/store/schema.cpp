#include "platform/linux/store/schema.h"

#include <cstdint>

#include "platform/linux/reporting_store.h"
#include "platform/linux/store/sqlite.h"

namespace qn::store {
namespace {

// A step from version N to N+1. Returns its error; sets *done to what it did, for the log.
using MigrationStep = std::optional<Error> (*)(sqlite3* db, std::string* done);

// Version 1: the first layout, a row per record in four tables.
std::optional<Error> CreateVersion1(sqlite3* db, std::string* done) {
  *done = "created the tables";
  return Exec(db, R"sql(
CREATE TABLE livo_sessions(
  id INTEGER PRIMARY KEY,
  session_info TEXT NOT NULL,
  user_info TEXT NOT NULL,
  created REAL NOT NULL,
  flushed REAL
);
CREATE TABLE livo_messages(
  id INTEGER PRIMARY KEY,
  session INTEGER REFERENCES livo_sessions(id),
  category INTEGER NOT NULL,
  type INTEGER NOT NULL,
  payload TEXT NOT NULL,
  session_info TEXT,
  user_info TEXT,
  time REAL NOT NULL
);
CREATE TABLE analytics_events(
  id INTEGER PRIMARY KEY,
  name TEXT NOT NULL,
  payload TEXT NOT NULL,
  time REAL NOT NULL
);
CREATE TABLE powerlog_events(
  id INTEGER PRIMARY KEY,
  subsystem INTEGER NOT NULL,
  name TEXT NOT NULL,
  payload TEXT NOT NULL,
  time REAL NOT NULL
);
)sql",
              "create the version 1 tables");
}

// Version 2: tables under new names whose ids come from store_sequences, an analytics event that
// repeats a message refers to it, views with the old names and shapes, and the exporters' cursors.
// Every old row moves with its id; old analytics rows keep their own payload.
std::optional<Error> MigrateToVersion2(sqlite3* db, std::string* done) {
  std::int64_t counts[4] = {0, 0, 0, 0};
  const char* count_sql[4] = {
      "SELECT count(*) FROM livo_sessions", "SELECT count(*) FROM livo_messages",
      "SELECT count(*) FROM analytics_events", "SELECT count(*) FROM powerlog_events"};
  for (int i = 0; i < 4; ++i) {
    if (auto e = QueryInt(db, count_sql[i], &counts[i])) return e;
  }
  if (auto e = Exec(db, R"sql(
CREATE TABLE store_sessions(
  id INTEGER PRIMARY KEY,
  session_info TEXT NOT NULL,
  user_info TEXT NOT NULL,
  created REAL NOT NULL,
  flushed REAL,
  last_message INTEGER
);
CREATE TABLE store_messages(
  id INTEGER PRIMARY KEY,
  session INTEGER,
  category INTEGER NOT NULL,
  type INTEGER NOT NULL,
  payload TEXT NOT NULL,
  session_info TEXT,
  user_info TEXT,
  time REAL NOT NULL
);
CREATE TABLE store_analytics(
  id INTEGER PRIMARY KEY,
  name TEXT NOT NULL,
  message INTEGER,
  host TEXT,
  payload TEXT,
  time REAL NOT NULL
);
CREATE INDEX store_analytics_message ON store_analytics(message) WHERE message IS NOT NULL;
CREATE TABLE store_powerlog(
  id INTEGER PRIMARY KEY,
  subsystem INTEGER NOT NULL,
  name TEXT NOT NULL,
  payload TEXT NOT NULL,
  time REAL NOT NULL
);
CREATE TABLE store_sequences(
  name TEXT PRIMARY KEY,
  last_id INTEGER NOT NULL
);
CREATE TABLE export_cursors(
  exporter TEXT NOT NULL,
  kind TEXT NOT NULL,
  last_id INTEGER NOT NULL,
  PRIMARY KEY(exporter, kind)
);
INSERT INTO store_sessions(id, session_info, user_info, created, flushed)
  SELECT id, session_info, user_info, created, flushed FROM livo_sessions ORDER BY id;
INSERT INTO store_messages(id, session, category, type, payload, session_info, user_info, time)
  SELECT id, session, category, type, payload, session_info, user_info, time
  FROM livo_messages ORDER BY id;
UPDATE store_sessions SET last_message = m.last
  FROM (SELECT session, max(id) AS last FROM store_messages WHERE session IS NOT NULL
        GROUP BY session) AS m
  WHERE m.session = store_sessions.id;
INSERT INTO store_analytics(id, name, payload, time)
  SELECT id, name, payload, time FROM analytics_events ORDER BY id;
INSERT INTO store_powerlog(id, subsystem, name, payload, time)
  SELECT id, subsystem, name, payload, time FROM powerlog_events ORDER BY id;
INSERT INTO store_sequences
  SELECT 'store_sessions', IFNULL(max(id), 0) FROM store_sessions UNION ALL
  SELECT 'store_messages', IFNULL(max(id), 0) FROM store_messages UNION ALL
  SELECT 'store_analytics', IFNULL(max(id), 0) FROM store_analytics UNION ALL
  SELECT 'store_powerlog', IFNULL(max(id), 0) FROM store_powerlog;
DROP TABLE livo_messages;
DROP TABLE livo_sessions;
DROP TABLE analytics_events;
DROP TABLE powerlog_events;
CREATE VIEW livo_sessions AS
  SELECT id, session_info, user_info, created, flushed FROM store_sessions;
CREATE VIEW livo_messages AS
  SELECT id, session, category, type, payload, session_info, user_info, time FROM store_messages;
CREATE VIEW analytics_events AS
  SELECT a.id AS id, a.name AS name,
         CASE WHEN a.message IS NULL THEN a.payload
              ELSE json_set(m.payload, '$.HostApplicationDisplayID', a.host) END AS payload,
         a.time AS time
  FROM store_analytics a LEFT JOIN store_messages m ON m.id = a.message;
CREATE VIEW powerlog_events AS
  SELECT id, subsystem, name, payload, time FROM store_powerlog;
)sql",
                    "migrate to version 2")) {
    return e;
  }
  *done = "moved " + std::to_string(counts[0]) + " sessions, " + std::to_string(counts[1]) +
          " messages, " + std::to_string(counts[2]) + " analytics events and " +
          std::to_string(counts[3]) + " power-log events";
  return std::nullopt;
}

// The steps in order: kSteps[N] takes version N to N+1.
constexpr MigrationStep kSteps[] = {CreateVersion1, MigrateToVersion2};
static_assert(std::size(kSteps) == kSchemaVersion);

void Note(Log* log, const char* format, const std::string& path, int from, int to,
          const std::string& what) {
  if (log) QN_LOG(*log, nullptr, LogLevel::kDefault, format, path, from, to, what);
}

}  // namespace

std::optional<Error> CheckSchemaVersion(sqlite3* db, const std::string& path, int* version) {
  std::int64_t found = 0;
  if (auto e = QueryInt(db, "PRAGMA user_version", &found)) return e;
  if (found > kSchemaVersion) {
    return Error{kReportingStoreErrorDomain, SQLITE_ERROR,
                 path + ": schema version " + std::to_string(found) +
                     " is newer than this program's (" + std::to_string(kSchemaVersion) +
                     "); the file is left as it is"};
  }
  *version = static_cast<int>(found);
  return std::nullopt;
}

std::optional<Error> MigrateSchema(sqlite3* db, const std::string& path, Log* log) {
  int version = 0;
  if (auto e = CheckSchemaVersion(db, path, &version)) return e;
  if (version == kSchemaVersion) return std::nullopt;
  // Takes effect only while the file has no table yet.
  if (version == 0) Exec(db, "PRAGMA auto_vacuum=INCREMENTAL", "set auto-vacuum");
  if (auto e = Exec(db, "BEGIN IMMEDIATE", "begin the migration of " + path)) return e;
  // Another process may have migrated it meanwhile; the version read inside counts.
  std::optional<Error> failure = CheckSchemaVersion(db, path, &version);
  for (; !failure && version < kSchemaVersion; ++version) {
    std::string done;
    failure = kSteps[version](db, &done);
    if (!failure) {
      Note(log, "%s:%d:%s: reporting store %s: schema version %d to %d: %s", path, version,
           version + 1, done);
    }
  }
  if (!failure) {
    const std::string set = "PRAGMA user_version=" + std::to_string(kSchemaVersion);
    failure = Exec(db, set.c_str(), "set the schema version");
  }
  if (!failure) failure = Exec(db, "COMMIT", "commit the migration of " + path);
  if (failure) {
    Exec(db, "ROLLBACK", "roll back");
    return failure;
  }
  return std::nullopt;
}

void EnsureIncrementalVacuum(sqlite3* db, const std::string& path, Log* log) {
  std::int64_t auto_vacuum = 0;
  if (QueryInt(db, "PRAGMA auto_vacuum", &auto_vacuum) || auto_vacuum == 2) return;
  // Switching a file with tables to incremental auto-vacuum takes a VACUUM (a copy of the
  // whole file); once done, retention can give pages back to the file system.
  auto e = Exec(db, "PRAGMA auto_vacuum=INCREMENTAL", "set auto-vacuum");
  if (!e) e = Exec(db, "VACUUM", "vacuum " + path);
  if (!log) return;
  if (e) {
    QN_LOG(*log, nullptr, LogLevel::kError,
           "%s:%d:%s: reporting store: %s; removed rows leave free pages in the file",
           e->description);
  } else {
    QN_LOG(*log, nullptr, LogLevel::kDefault,
           "%s:%d:%s: reporting store %s: vacuumed the file, so that it can shrink", path);
  }
}

}  // namespace qn::store
