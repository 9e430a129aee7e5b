#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"

struct sqlite3;

namespace qn {

// Read access to the reporting store's database, for the command-line tool
// (`qnreport events [--sink reporting|analytics|powerlog] [--json]`).
//
// What it reads (the views of schema version 2, platform/linux/store/schema.h; version 1
// had tables of the same names and columns):
//   livo_sessions(id, session_info TEXT, user_info TEXT, created REAL, flushed REAL NULL)
//       one row per framework session; flushed is set by each flush of the session.
//   livo_messages(id, session NULL, category, type, payload TEXT, session_info TEXT NULL,
//                 user_info TEXT NULL, time REAL)
//       session is the livo_sessions id of the message's session, NULL for a single
//       message, which then carries its own session_info and user_info.
//   analytics_events(id, name TEXT, payload TEXT, time REAL)
//       an event that repeats a message is rebuilt from it: the message's payload with
//       the event's HostApplicationDisplayID set.
//   powerlog_events(id, subsystem, name TEXT, payload TEXT, time REAL)
// Every TEXT column except names holds compact lenient JSON (ToJsonLenient in common/Json.h
// says how values JSON cannot hold are written). Times are seconds since the Unix epoch,
// taken when the record was handed to the store. Within a view, ids follow the order of
// hand-over and are never reused, also after retention removed rows.

// The sinks whose rows the store keeps: "reporting" (livo_sessions and livo_messages),
// "analytics", "powerlog".
enum class ReportingSink { kReporting, kAnalytics, kPowerLog };

// "reporting", "analytics" or "powerlog".
const char* ReportingSinkName(ReportingSink sink);
// The sink of that name, or nullopt for any other text.
std::optional<ReportingSink> ParseReportingSink(std::string_view name);

// One row of any of the four tables. Fields that the row's table does not have stay at
// their defaults (0, empty, nullopt).
struct ReportingStoreRow {
  enum class Table { kLivoSession, kLivoMessage, kAnalyticsEvent, kPowerLogEvent };

  Table table = Table::kLivoMessage;
  std::int64_t id = 0;
  double time = 0;                      // livo_sessions: the created time
  std::optional<double> flushed;        // livo_sessions
  std::optional<std::int64_t> session;  // livo_messages; nullopt for a single message
  std::int64_t category = 0;            // livo_messages
  std::int64_t type = 0;                // livo_messages
  std::int64_t subsystem = 0;           // powerlog_events
  std::string name;                     // analytics_events, powerlog_events
  std::string payload;                  // JSON; livo_messages and the two event tables
  std::string session_info;             // JSON; livo_sessions and single messages
  std::string user_info;                // JSON; livo_sessions and single messages

  ReportingSink sink() const;
  // "livo_sessions", "livo_messages", "analytics_events" or "powerlog_events".
  const char* table_name() const;
};

// Which rows ForEachRow visits. Every condition set must hold.
struct ReportingRowFilter {
  std::optional<ReportingSink> sink;    // only this sink's tables
  std::optional<double> since;          // only rows at or after this time (seconds)
  std::optional<std::int64_t> session;  // only this framework session's row and messages
  // Only rows past these ids, one per table in Table order: for following a store as it
  // grows, pass the ids of the last rows seen (Advance keeps them).
  std::int64_t after[4] = {0, 0, 0, 0};

  // Notes `row` as seen, so that the next read starts after it.
  void Advance(const ReportingStoreRow& row);
};

// A read-only connection to the store's database. It never writes and never blocks the
// store's writer (WAL readers do not lock writers out). Not thread-safe: use one reader
// per thread.
class ReportingStoreReader {
 public:
  // Opens `path` read-only. Returns null and sets *error (when not null) when the file
  // does not exist, is not a database, or has no store schema.
  static std::unique_ptr<ReportingStoreReader> Open(const std::string& path,
                                                    std::optional<Error>* error);
  ReportingStoreReader(const ReportingStoreReader&) = delete;
  ReportingStoreReader& operator=(const ReportingStoreReader&) = delete;

  using Visitor = std::function<bool(const ReportingStoreRow&)>;

  // Calls `visit` for each row that `filter` lets through (of `sink`: all sinks when
  // nullopt), from one consistent
  // snapshot of the database: each table in id order, the tables merged by time (at equal
  // times sessions come first, then messages, analytics and power-log rows). Stops early
  // when `visit` returns false. Returns the error when reading failed (rows visited before
  // it stay visited).
  std::optional<Error> ForEachRow(const ReportingRowFilter& filter, const Visitor& visit);
  std::optional<Error> ForEachRow(std::optional<ReportingSink> sink, const Visitor& visit) {
    ReportingRowFilter filter;
    filter.sink = sink;
    return ForEachRow(filter, visit);
  }

  struct Closer {
    void operator()(sqlite3* db) const;
  };
  using Connection = std::unique_ptr<sqlite3, Closer>;

  // Private to the implementation (Open makes readers).
  explicit ReportingStoreReader(Connection db);

 private:
  Connection db_;
};

}  // namespace qn
