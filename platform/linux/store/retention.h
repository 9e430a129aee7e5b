#pragma once

#include <sqlite3.h>

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"
#include "platform/linux/store/sqlite.h"
#include "platform/log.h"

namespace qn::store {

// What retention keeps. A byte limit of 0 means none; an age of 0 means none.
struct RetentionLimits {
  std::uint64_t max_bytes = 0;  // of the database file (the WAL is bounded on its own)
  double max_age_seconds = 0;
};

// The default byte limit for a store in `folder`: 10% of its file system, at most 4 GiB
// (journald's convention). 4 GiB when the file system cannot be asked.
std::uint64_t DefaultMaxBytes(const std::string& folder);

// "512", "64K", "64M", "4G", "1T" (powers of 1024; "B" and "iB" suffixes allowed):
// bytes, or nullopt for any other text or a value that does not fit.
std::optional<std::uint64_t> ParseByteSize(std::string_view text);
// "90", "90s", "15min", "12h", "30d", "4w", or several of them ("1d 12h"): seconds, or
// nullopt for any other text.
std::optional<double> ParseDuration(std::string_view text);

// What retention has done, for the stats.
struct RetentionStats {
  std::uint64_t removed = 0;  // rows removed
  std::uint64_t lost = 0;     // of them, rows no exporter had shipped yet
  std::uint64_t bytes_on_disk = 0;
  std::optional<double> oldest_time;  // of the oldest row left (wall-clock seconds)
};

// Keeps the store within its limits: removes the oldest rows first, in small steps (each
// one short transaction), and gives the freed pages back to the file system (incremental
// vacuum), so that the file really shrinks. What it keeps:
//   - rows an exporter has not shipped yet (some export_cursors row of the kind has a
//     last_id below the row's id) go last: only the byte limit removes them, when nothing
//     else is left to remove; they are counted as lost and logged.
//   - a session row stays while any of its messages does;
//   - an analytics event that refers to a message goes with it (a message stays while such
//     an event is not shipped).
// The age limit removes shipped rows only. Past the byte limit it removes down to 95% of
// it, so that it does not run after every batch.
// Writer thread only (it uses the writer's connection between transactions).
class Retention {
 public:
  Retention(sqlite3* db, std::shared_ptr<Log> log, RetentionLimits limits);

  // Prepares the statements; the schema must be current.
  std::optional<Error> Prepare();

  // Between two transactions: when a limit is passed (the size is looked at every call,
  // the age once a second), removes one step of rows. Returns whether it should be called
  // again soon (a limit is still passed), also when nothing has been written meanwhile.
  bool Run(double now);

  const RetentionStats& stats() const { return stats_; }

 private:
  enum Kind { kSessions, kMessages, kAnalytics, kPowerLog, kKinds };

  // Removes up to one step of the oldest rows that may go, older than `before`; when
  // `shipped_only` is false, unshipped rows too. Returns the rows removed.
  std::uint64_t Step(double before, bool shipped_only);
  std::optional<double> OldestTime(Kind kind, bool shipped_only);
  void RefreshSize();
  void RefreshOldest();
  void Note(const char* what, double now);

  sqlite3* const db_;
  const std::shared_ptr<Log> log_;
  const RetentionLimits limits_;
  Statement cursor_[kKinds];  // min(last_id) of the kind's export cursors
  Statement oldest_[kKinds];  // the oldest removable row's time
  Statement select_[kKinds];  // up to ?4 removable ids, oldest first
  Statement delete_[kKinds];  // one row by id
  Statement delete_refs_;     // analytics events that refer to message ?1
  Statement first_time_[kKinds];
  std::int64_t shipped_[kKinds] = {};  // this step's cut: ids up to it are shipped
  bool over_bytes_ = false;
  double next_age_check_ = 0;
  double next_oldest_check_ = 0;
  double last_removal_ = -1e300;
  double last_loss_log_ = -1e300;
  std::uint64_t lost_unlogged_ = 0;
  RetentionStats stats_;
};

}  // namespace qn::store
