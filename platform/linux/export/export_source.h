#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/Error.h"
#include "platform/linux/store/sqlite.h"

namespace qn {

// What the exporter ships, one per table the store's readers see: "sessions"
// (livo_sessions), "messages" (livo_messages), "analytics" (analytics_events) and
// "powerlog" (powerlog_events). The name is the last token of the subject and the middle
// part of the message ID.
enum class ExportKind { kSessions, kMessages, kAnalytics, kPowerLog };
inline constexpr std::size_t kExportKinds = 4;
inline constexpr std::array<ExportKind, kExportKinds> kAllExportKinds = {
    ExportKind::kSessions, ExportKind::kMessages, ExportKind::kAnalytics, ExportKind::kPowerLog};
const char* ExportKindName(ExportKind kind);

// One row as it is published.
struct ExportRow {
  std::int64_t id = 0;
  double time = 0;       // seconds since the epoch (a session's created time)
  bool flushed = false;  // sessions: whether the session was flushed; true for other kinds
  std::string body;      // the JSON object published (see ExportSource::Read)
};

// Per kind, how many rows lie after the cursors and the time of the oldest of them.
struct ExportLag {
  std::int64_t rows = 0;
  std::optional<double> oldest_time;
};

// The exporter's connection to the store's database: it reads rows after a cursor and
// keeps the cursors in the table `export_cursors(exporter, kind, last_id)`. Reads never
// block the store's writer (WAL); saving cursors is a short write transaction that waits
// up to the busy timeout for the writer. Not thread-safe: one exporter thread uses it.
class ExportSource {
 public:
  // Opens the database at `path` (read-write, never creating it). Returns null and sets
  // *error when it cannot be opened or has no table of cursors.
  static std::unique_ptr<ExportSource> Open(const std::string& path, std::string device,
                                            std::optional<Error>* error);
  ~ExportSource();
  ExportSource(const ExportSource&) = delete;
  ExportSource& operator=(const ExportSource&) = delete;

  // Appends to `out` the rows of `kind` with an id above `after`, in id order, at most
  // `limit`. Each body is one JSON object: the row's columns under their names (JSON
  // columns as JSON, NULL as null) plus "device", "kind", "id" and "time".
  std::optional<Error> Read(ExportKind kind, std::int64_t after, int limit,
                            std::vector<ExportRow>& out);
  // The session row `id`, if it still exists.
  std::optional<ExportRow> ReadSession(std::int64_t id, std::optional<Error>* error);
  // The highest session id in the store now (0 when there is none).
  std::int64_t LastSessionId();

  // The saved cursors of `exporter`, in kAllExportKinds order (0 where none was saved).
  std::optional<Error> LoadCursors(const std::string& exporter,
                                   std::array<std::int64_t, kExportKinds>& cursors);
  // Saves the cursors of `exporter` in one transaction.
  std::optional<Error> SaveCursors(const std::string& exporter,
                                   const std::array<std::int64_t, kExportKinds>& cursors);
  // The rows of `kind` above `after` and the time of the first of them.
  std::optional<Error> Lag(ExportKind kind, std::int64_t after, ExportLag& out);

  // Made by Open.
  ExportSource(sqlite3* db, std::string device);

 private:
  using Statement = store::Statement;
  std::optional<Error> Prepare(Statement& stmt, const char* sql);
  Error Failure(const std::string& what) const;
  void AppendBody(ExportKind kind, sqlite3_stmt* stmt, ExportRow& row);

  sqlite3* db_;
  const std::string device_;
  std::array<Statement, kExportKinds> read_;
  std::array<Statement, kExportKinds> lag_;
  Statement session_, last_session_, load_, save_;
};

}  // namespace qn
