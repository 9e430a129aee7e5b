#include "platform/linux/store/retention.h"

#include <sys/statvfs.h>

#include <algorithm>
#include <cmath>
#include <limits>
#include <vector>

namespace qn::store {
namespace {

constexpr std::uint64_t kMostDefaultBytes = std::uint64_t{4} << 30;
// Rows removed per step: a few milliseconds of the writer's time.
constexpr int kStepRows = 1000;
// After this long without removing, the next removal is logged again.
constexpr double kQuietSeconds = 600;
// Losses of unshipped rows are logged at most this often.
constexpr double kLossLogSeconds = 60;
constexpr double kForever = std::numeric_limits<double>::infinity();
constexpr std::int64_t kAll = std::numeric_limits<std::int64_t>::max();

struct KindSql {
  const char* name;   // in export_cursors.kind
  const char* table;  // its table
  const char* time;   // its time column
  const char* keep;   // what keeps a row besides the cut and the time (alias t)
};

constexpr KindSql kKindSql[] = {
    {"sessions", "store_sessions", "created",
     "(t.last_message IS NULL OR t.last_message < "
     "(SELECT IFNULL(min(id), 9223372036854775807) FROM store_messages))"},
    {"messages", "store_messages", "time",
     "NOT EXISTS (SELECT 1 FROM store_analytics a WHERE a.message = t.id AND a.id > ?3)"},
    {"analytics", "store_analytics", "time", "1"},
    {"powerlog", "store_powerlog", "time", "1"},
};

}  // namespace

std::uint64_t DefaultMaxBytes(const std::string& folder) {
  struct statvfs fs {};
  if (statvfs(folder.c_str(), &fs) != 0) return kMostDefaultBytes;
  const auto total = static_cast<std::uint64_t>(fs.f_blocks) * fs.f_frsize;
  return std::min(total / 10, kMostDefaultBytes);
}

std::optional<std::uint64_t> ParseByteSize(std::string_view text) {
  std::size_t digits = 0;
  std::uint64_t value = 0;
  for (; digits < text.size() && text[digits] >= '0' && text[digits] <= '9'; ++digits) {
    if (value > (UINT64_MAX - 9) / 10) return std::nullopt;
    value = value * 10 + static_cast<std::uint64_t>(text[digits] - '0');
  }
  if (digits == 0) return std::nullopt;
  std::string_view unit = text.substr(digits);
  if (unit.ends_with("iB"))
    unit.remove_suffix(2);
  else if (unit.ends_with("B"))
    unit.remove_suffix(1);
  int shift = 0;
  if (unit == "K")
    shift = 10;
  else if (unit == "M")
    shift = 20;
  else if (unit == "G")
    shift = 30;
  else if (unit == "T")
    shift = 40;
  else if (!unit.empty())
    return std::nullopt;
  if (value > (UINT64_MAX >> shift)) return std::nullopt;
  return value << shift;
}

std::optional<double> ParseDuration(std::string_view text) {
  struct Unit {
    std::string_view name;
    double seconds;
  };
  constexpr Unit kUnits[] = {{"s", 1},    {"sec", 1},   {"min", 60},  {"m", 60},
                             {"h", 3600}, {"d", 86400}, {"w", 604800}};
  double total = 0;
  bool any = false;
  while (!text.empty()) {
    if (text.front() == ' ') {
      text.remove_prefix(1);
      continue;
    }
    std::size_t digits = 0;
    double value = 0;
    for (; digits < text.size() && text[digits] >= '0' && text[digits] <= '9'; ++digits) {
      value = value * 10 + (text[digits] - '0');
    }
    if (digits == 0) return std::nullopt;
    text.remove_prefix(digits);
    const std::size_t letters = std::min(text.find(' '), text.find_first_of("0123456789"));
    const std::string_view unit = text.substr(0, letters);
    text.remove_prefix(unit.size());
    double seconds = unit.empty() ? 1 : 0;
    for (const Unit& u : kUnits) {
      if (unit == u.name) seconds = u.seconds;
    }
    if (seconds == 0) return std::nullopt;
    total += value * seconds;
    any = true;
  }
  if (!any || !std::isfinite(total)) return std::nullopt;
  return total;
}

Retention::Retention(sqlite3* db, std::shared_ptr<Log> log, RetentionLimits limits)
    : db_(db), log_(std::move(log)), limits_(limits) {}

std::optional<Error> Retention::Prepare() {
  for (int k = 0; k < kKinds; ++k) {
    const KindSql& s = kKindSql[k];
    const std::string cut =
        std::string("SELECT min(last_id) FROM export_cursors WHERE kind = '") + s.name + "'";
    const std::string removable = std::string(" FROM ") + s.table + " t WHERE t.id <= ?1 AND t." +
                                  s.time + " < ?2 AND " + s.keep + " ORDER BY t.id";
    const std::string oldest = std::string("SELECT t.") + s.time + removable + " LIMIT 1";
    const std::string select = "SELECT t.id" + removable + " LIMIT ?4";
    const std::string remove = std::string("DELETE FROM ") + s.table + " WHERE id = ?1";
    const std::string first =
        std::string("SELECT ") + s.time + " FROM " + s.table + " ORDER BY id LIMIT 1";
    for (auto [sql, stmt] : {std::pair{&cut, &cursor_[k]}, std::pair{&oldest, &oldest_[k]},
                             std::pair{&select, &select_[k]}, std::pair{&remove, &delete_[k]},
                             std::pair{&first, &first_time_[k]}}) {
      if (auto e = store::Prepare(db_, sql->c_str(), stmt)) return e;
    }
  }
  return store::Prepare(db_, "DELETE FROM store_analytics WHERE message = ?1", &delete_refs_);
}

void Retention::RefreshSize() {
  std::int64_t pages = 0;
  std::int64_t page_size = 0;
  QueryInt(db_, "PRAGMA page_count", &pages);
  QueryInt(db_, "PRAGMA page_size", &page_size);
  stats_.bytes_on_disk = static_cast<std::uint64_t>(pages * page_size);
}

void Retention::RefreshOldest() {
  stats_.oldest_time.reset();
  for (int k = 0; k < kKinds; ++k) {
    sqlite3_stmt* stmt = first_time_[k].get();
    if (sqlite3_step(stmt) == SQLITE_ROW) {
      const double time = sqlite3_column_double(stmt, 0);
      if (!stats_.oldest_time || time < *stats_.oldest_time) stats_.oldest_time = time;
    }
    sqlite3_reset(stmt);
  }
}

std::optional<double> Retention::OldestTime(Kind kind, bool shipped_only) {
  sqlite3_stmt* stmt = oldest_[kind].get();
  sqlite3_bind_int64(stmt, 1, shipped_only ? shipped_[kind] : kAll);
  sqlite3_bind_double(stmt, 2, kForever);
  sqlite3_bind_int64(stmt, 3, shipped_only ? shipped_[kAnalytics] : kAll);
  std::optional<double> time;
  if (sqlite3_step(stmt) == SQLITE_ROW) time = sqlite3_column_double(stmt, 0);
  sqlite3_reset(stmt);
  return time;
}

std::uint64_t Retention::Step(double before, bool shipped_only) {
  if (Exec(db_, "BEGIN IMMEDIATE", "retention")) return 0;
  for (int k = 0; k < kKinds; ++k) {
    shipped_[k] = kAll;
    sqlite3_stmt* stmt = cursor_[k].get();
    if (sqlite3_step(stmt) == SQLITE_ROW && sqlite3_column_type(stmt, 0) != SQLITE_NULL) {
      shipped_[k] = sqlite3_column_int64(stmt, 0);
    }
    sqlite3_reset(stmt);
  }
  // The kind whose oldest removable row is the oldest of all, up to the next kind's oldest.
  std::optional<double> times[kKinds];
  int kind = -1;
  for (int k = 0; k < kKinds; ++k) {
    times[k] = OldestTime(static_cast<Kind>(k), shipped_only);
    if (times[k] && *times[k] < before && (kind < 0 || *times[k] < *times[kind])) kind = k;
  }
  std::vector<std::int64_t> ids;
  if (kind >= 0) {
    double bound = before;
    for (int k = 0; k < kKinds; ++k) {
      if (k != kind && times[k]) bound = std::min(bound, *times[k]);
    }
    bound = std::max(bound, std::nextafter(*times[kind], kForever));
    sqlite3_stmt* stmt = select_[kind].get();
    sqlite3_bind_int64(stmt, 1, shipped_only ? shipped_[kind] : kAll);
    sqlite3_bind_double(stmt, 2, bound);
    sqlite3_bind_int64(stmt, 3, shipped_only ? shipped_[kAnalytics] : kAll);
    sqlite3_bind_int(stmt, 4, kStepRows);
    while (sqlite3_step(stmt) == SQLITE_ROW) ids.push_back(sqlite3_column_int64(stmt, 0));
    sqlite3_reset(stmt);
  }
  std::uint64_t removed = 0;
  std::uint64_t lost = 0;
  for (std::int64_t id : ids) {
    if (kind == kMessages) {
      sqlite3_bind_int64(delete_refs_.get(), 1, id);
      if (store::Step(delete_refs_.get()) != SQLITE_DONE) break;
      const auto events = static_cast<std::uint64_t>(sqlite3_changes(db_));
      removed += events;
      if (!shipped_only && shipped_[kAnalytics] != kAll) lost += events;
    }
    sqlite3_bind_int64(delete_[kind].get(), 1, id);
    if (store::Step(delete_[kind].get()) != SQLITE_DONE) break;
    ++removed;
    if (id > shipped_[kind]) ++lost;
  }
  if (Exec(db_, "COMMIT", "retention")) {
    Exec(db_, "ROLLBACK", "retention");
    return 0;
  }
  stats_.removed += removed;
  stats_.lost += lost;
  lost_unlogged_ += lost;
  return removed;
}

void Retention::Note(const char* what, double now) {
  if (now - last_removal_ >= kQuietSeconds && log_) {
    QN_LOG(*log_, nullptr, LogLevel::kDefault,
           "%s:%d:%s: reporting store: removing the oldest rows, %s (%llu bytes in the file)", what,
           static_cast<unsigned long long>(stats_.bytes_on_disk));
  }
  last_removal_ = now;
  if (lost_unlogged_ > 0 && now - last_loss_log_ >= kLossLogSeconds) {
    if (log_) {
      QN_LOG(*log_, nullptr, LogLevel::kError,
             "%s:%d:%s: reporting store: removed %llu rows that no exporter had shipped yet, "
             "to stay within %llu bytes",
             static_cast<unsigned long long>(lost_unlogged_),
             static_cast<unsigned long long>(limits_.max_bytes));
    }
    lost_unlogged_ = 0;
    last_loss_log_ = now;
  }
}

bool Retention::Run(double now) {
  RefreshSize();
  const std::uint64_t max_bytes = limits_.max_bytes;
  if (max_bytes > 0 && stats_.bytes_on_disk > max_bytes) {
    over_bytes_ = true;
  } else if (stats_.bytes_on_disk <= max_bytes - max_bytes / 20) {
    over_bytes_ = false;
  }
  std::uint64_t removed = 0;
  const char* why = nullptr;
  if (over_bytes_) {
    why = "past the size limit";
    removed = Step(kForever, true);
    if (removed == 0) removed = Step(kForever, false);
  } else if (limits_.max_age_seconds > 0 && now >= next_age_check_) {
    why = "past the age limit";
    removed = Step(now - limits_.max_age_seconds, true);
    if (removed == 0) next_age_check_ = now + 1;
  }
  if (removed > 0) {
    // Gives the freed pages back: the file shrinks at the next checkpoint.
    Exec(db_, "PRAGMA incremental_vacuum", "incremental vacuum");
    RefreshSize();
    Note(why, now);
  }
  if (removed > 0 || now >= next_oldest_check_) {
    RefreshOldest();
    next_oldest_check_ = now + 1;
  }
  return removed > 0;
}

}  // namespace qn::store
