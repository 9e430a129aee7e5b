#include "tools/qnreport/Admin.h"

#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <map>
#include <optional>
#include <ostream>
#include <utility>
#include <vector>

#include "Statistics/QNReportingUtility.h"
#include "common/Json.h"
#include "platform/linux/linux_defaults.h"
#include "platform/linux/linux_notify.h"
#include "platform/linux/linux_orientation.h"
#include "platform/linux/linux_stats.h"
#include "platform/linux/reporting_store_reader.h"
#include "platform/linux/small_file.h"

namespace qn::qnreport {
namespace {

constexpr const char* kSuite = "com.norvel.quenta";
constexpr int kExitFailure = 1;
int Failure(std::ostream& err, const std::string& what, const Error& error) {
  err << "qnreport: " << what << ": " << error.Description() << "\n";
  return kExitFailure;
}

// "2026-11-21 01:39:35.123" in local time.
std::string LocalTime(double seconds) {
  const std::time_t whole = static_cast<std::time_t>(std::floor(seconds));
  std::tm tm{};
  localtime_r(&whole, &tm);
  char text[32];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &tm);
  char millis[8];
  std::snprintf(millis, sizeof millis, ".%03d",
                static_cast<int>((seconds - std::floor(seconds)) * 1000) % 1000);
  return std::string(text) + millis;
}

// The row as one JSON object: every field its table has.
std::string RowJson(const ReportingStoreRow& row) {
  Dictionary d;
  d.Set("table", row.table_name());
  d.Set("id", row.id);
  d.Set("time", row.time);
  auto embed = [&d](const char* key, const std::string& json) {
    Value parsed;
    if (json.empty() || ParseJson(json, parsed)) return;
    d.Set(key, parsed);
  };
  switch (row.table) {
    case ReportingStoreRow::Table::kLivoSession:
      if (row.flushed) d.Set("flushed", *row.flushed);
      embed("session_info", row.session_info);
      embed("user_info", row.user_info);
      break;
    case ReportingStoreRow::Table::kLivoMessage:
      d.Set("session", row.session ? Value(*row.session) : Value());
      d.Set("category", row.category);
      d.Set("type", row.type);
      embed("payload", row.payload);
      embed("session_info", row.session_info);
      embed("user_info", row.user_info);
      break;
    case ReportingStoreRow::Table::kAnalyticsEvent:
      d.Set("name", row.name);
      embed("payload", row.payload);
      break;
    case ReportingStoreRow::Table::kPowerLogEvent:
      d.Set("subsystem", row.subsystem);
      d.Set("name", row.name);
      embed("payload", row.payload);
      break;
  }
  return ToJsonLenient(Value(std::move(d)));
}

// Pads `text` with blanks to `width` columns (at least one blank follows).
std::string Column(std::string text, std::size_t width) {
  text.resize(std::max(width, text.size() + 1), ' ');
  return text;
}

// "5 Setup": the number and its name.
std::string Named(std::int64_t number, const std::string& name) {
  return std::to_string(number) + " " + name;
}

constexpr const char* kEventsHeader =
    "TIME                     SINK       SESSION  CATEGORY            TYPE            DETAILS";

// The row as aligned columns for people: time, sink, session, category, type, and the
// rest (payload, names). Widths are fixed so that followed rows line up too.
std::string RowText(const ReportingStoreRow& row) {
  std::string line = Column(LocalTime(row.time), 25) + Column(ReportingSinkName(row.sink()), 11);
  switch (row.table) {
    case ReportingStoreRow::Table::kLivoSession:
      line += Column(std::to_string(row.id), 9) + Column("started", 20) + Column("", 16) +
              row.user_info;
      if (row.flushed) line += "  flushed " + LocalTime(*row.flushed);
      return line;
    case ReportingStoreRow::Table::kLivoMessage:
      return line + Column(row.session ? std::to_string(*row.session) : "single", 9) +
             Column(Named(row.category,
                          QNReportingCategoryName(static_cast<std::uint32_t>(row.category))),
                    20) +
             Column(Named(row.type, QNReportingTypeName(static_cast<std::uint16_t>(row.type))),
                    16) +
             row.payload;
    case ReportingStoreRow::Table::kAnalyticsEvent:
      return line + Column("-", 9) + Column("-", 20) + Column("-", 16) + row.name + "  " +
             row.payload;
    case ReportingStoreRow::Table::kPowerLogEvent:
      return line + Column("-", 9) + Column(std::to_string(row.subsystem), 20) + Column("-", 16) +
             row.name + "  " + row.payload;
  }
  return line;
}

std::string StorePath(const Paths& paths) { return paths.state_dir + "/reports.db"; }

std::unique_ptr<ReportingStoreReader> OpenStore(const Paths& paths, std::ostream& err) {
  std::optional<Error> error;
  auto reader = ReportingStoreReader::Open(StorePath(paths), &error);
  if (!reader) Failure(err, "opening " + StorePath(paths), *error);
  return reader;
}

// Waits until something in the store's folder changes (the writer appends to the
// write-ahead log), or a second passes, whichever comes first.
class StoreWatch {
 public:
  explicit StoreWatch(const std::string& dir) : fd_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
    if (fd_ >= 0) inotify_add_watch(fd_, dir.c_str(), IN_MODIFY | IN_CREATE | IN_MOVED_TO);
  }
  ~StoreWatch() {
    if (fd_ >= 0) ::close(fd_);
  }
  StoreWatch(const StoreWatch&) = delete;
  StoreWatch& operator=(const StoreWatch&) = delete;

  void Wait() {
    pollfd p{fd_, POLLIN, 0};
    if (::poll(&p, 1, 1000) <= 0 || fd_ < 0) return;
    char buffer[4096];
    while (::read(fd_, buffer, sizeof buffer) > 0) {
    }
  }

 private:
  int fd_;
};

// A JSON column as a dictionary (empty when it is not one).
Dictionary JsonDictionary(const std::string& text) {
  Value value;
  if (text.empty() || ParseJson(text, value) || !value.as_dictionary()) return Dictionary();
  return *value.as_dictionary();
}

std::string StringIn(const Dictionary& d, const char* key, const std::string& otherwise) {
  const Value* value = d.Find(key);
  if (!value) return otherwise;
  return value->as_string() ? *value->as_string() : value->Description();
}

// The summary files that a session with this host application wrote when it stopped:
// "<date>-quenta-<host>-<service type>.json", last changed around the stop.
std::vector<std::string> SummaryFiles(const Paths& paths, const std::string& host, double stopped) {
  std::vector<std::string> found;
  const std::filesystem::path dir = paths.log_dir + "/DiagnosticLogs/Audio/Reporting";
  std::error_code error;
  for (const auto& entry : std::filesystem::directory_iterator(dir, error)) {
    const std::string name = entry.path().filename().string();
    if (name.find("-quenta-" + host + "-") == std::string::npos || !name.ends_with(".json")) {
      continue;
    }
    const auto written = std::chrono::file_clock::to_sys(entry.last_write_time(error));
    const double when = std::chrono::duration<double>(written.time_since_epoch()).count();
    if (when >= stopped - 1 && when <= stopped + 10) found.push_back(entry.path().string());
  }
  return found;
}

}  // namespace

std::optional<double> ParseTimeArgument(const std::string& text, double now) {
  if (text.size() >= 3 && text[0] == '-') {
    static const std::map<std::string, double, std::less<>> kUnits = {
        {"s", 1}, {"m", 60}, {"h", 3600}, {"d", 86400}};
    char* end = nullptr;
    const double amount = std::strtod(text.c_str() + 1, &end);
    auto unit = kUnits.find(std::string_view(end));
    if (end == text.c_str() + 1 || unit == kUnits.end() || !(amount >= 0)) return std::nullopt;
    return now - amount * unit->second;
  }
  std::tm today{};
  const std::time_t whole = static_cast<std::time_t>(now);
  localtime_r(&whole, &today);
  today.tm_sec = today.tm_min = today.tm_hour = 0;
  for (const char* format :
       {"%Y-%m-%d %H:%M:%S", "%Y-%m-%d %H:%M", "%Y-%m-%d", "%H:%M:%S", "%H:%M"}) {
    std::tm parsed = today;
    const char* end = strptime(text.c_str(), format, &parsed);
    if (end && *end == '\0') {
      parsed.tm_isdst = -1;
      return static_cast<double>(std::mktime(&parsed));
    }
  }
  char* end = nullptr;
  const double seconds = std::strtod(text.c_str(), &end);
  if (!text.empty() && *end == '\0' && std::isfinite(seconds)) return seconds;
  return std::nullopt;
}

int RunDefaultsRead(const Paths& paths, std::ostream& out, std::ostream& err) {
  Dictionary suite;
  if (auto error = ReadSuite(paths.state_dir, kSuite, suite)) {
    return Failure(err, "reading the defaults", *error);
  }
  out << ToJsonLenient(Value(std::move(suite)), JsonStyle::kPretty) << "\n";
  return 0;
}

int RunDefaultsWrite(const Paths& paths, const std::string& key, const std::string& text,
                     std::ostream& err) {
  Value value;
  if (ParseJson(text, value)) value = Value(text);  // not JSON: a plain string
  if (auto error = WriteDefault(paths.state_dir, kSuite, key, value)) {
    return Failure(err, "writing " + key, *error);
  }
  return 0;
}

int RunDefaultsDelete(const Paths& paths, const std::string& key, std::ostream& err) {
  if (auto error = DeleteDefault(paths.state_dir, kSuite, key)) {
    return Failure(err, "deleting " + key, *error);
  }
  return 0;
}

int RunNotifyPost(const Paths& paths, const std::string& name, std::ostream& err) {
  if (std::uint32_t status = PostNotification(paths.runtime_dir, name); status != 0) {
    err << "qnreport: posting " << name << " failed (status " << status << ")\n";
    return kExitFailure;
  }
  return 0;
}

int RunOrientation(const Paths& paths, const std::optional<std::string>& ui, std::ostream& out,
                   std::ostream& err) {
  if (ui) {
    if (auto error = PostUIOrientation(paths.runtime_dir, *ui)) {
      return Failure(err, "posting the UI orientation", *error);
    }
    return 0;
  }
  const PostedOrientation posted = ReadPostedOrientation(paths.runtime_dir);
  out << "device: " << posted.device.value_or("none") << "\nui: " << posted.ui.value_or("none")
      << "\n";
  return 0;
}

int RunEvents(const Paths& paths, const EventsOptions& options, std::ostream& out,
              std::ostream& err) {
  auto reader = OpenStore(paths, err);
  if (!reader) return kExitFailure;
  if (!options.json) out << kEventsHeader << "\n";
  ReportingRowFilter filter = options.filter;
  std::optional<StoreWatch> watch;
  if (options.follow) watch.emplace(paths.state_dir);
  for (;;) {
    auto error = reader->ForEachRow(filter, [&](const ReportingStoreRow& row) {
      filter.Advance(row);
      out << (options.json ? RowJson(row) : RowText(row)) << "\n";
      return static_cast<bool>(out);
    });
    if (error) return Failure(err, "reading the store", *error);
    if (!options.follow || !out.flush()) return 0;
    watch->Wait();
  }
}

int RunSession(const Paths& paths, std::int64_t session, std::ostream& out, std::ostream& err) {
  auto reader = OpenStore(paths, err);
  if (!reader) return kExitFailure;
  std::optional<ReportingStoreRow> start, summary, drivers;
  std::map<std::pair<std::int64_t, std::int64_t>, int> counts;  // (category, type) -> count
  int total = 0;
  ReportingRowFilter filter;
  filter.session = session;
  auto error = reader->ForEachRow(filter, [&](const ReportingStoreRow& row) {
    if (row.table == ReportingStoreRow::Table::kLivoSession) {
      start = row;
      return true;
    }
    ++counts[{row.category, row.type}];
    ++total;
    if (row.category == 0xFFFF && row.type == 0xFFFF) summary = row;
    if (row.category == 9 && row.type == 0) drivers = row;
    return true;
  });
  if (error) return Failure(err, "reading the store", *error);
  if (!start) {
    err << "qnreport: the store has no session " << session
        << " (`qnreport events --sink reporting` lists them)\n";
    return kExitFailure;
  }
  const Dictionary info = JsonDictionary(start->session_info);
  const Dictionary user = JsonDictionary(start->user_info);
  const std::string host = StringIn(user, "HostApplicationDisplayID", "unknown");
  out << "Session " << session << ": reporter " << StringIn(info, "SessionID", "?") << ", "
      << StringIn(user, "ServiceName", "no service name") << ", " << host << "\n"
      << "  started   " << LocalTime(start->time) << "\n"
      << "  stopped   " << (start->flushed ? LocalTime(*start->flushed) : "not yet") << "\n"
      << "  messages  " << total << "\n";
  for (const auto& [key, count] : counts) {
    const auto [category, type] = key;
    out << "    "
        << Column(Named(category, QNReportingCategoryName(static_cast<std::uint32_t>(category))),
                  22)
        << Column(Named(type, QNReportingTypeName(static_cast<std::uint16_t>(type))), 18) << count
        << "\n";
  }
  out << "  summary   " << (summary ? summary->payload : "none (nothing was aggregated)") << "\n"
      << "  drivers   " << (drivers ? drivers->payload : "no driver-statistics change recorded")
      << "\n";
  const auto files =
      start->flushed ? SummaryFiles(paths, host, *start->flushed) : std::vector<std::string>();
  if (files.empty()) out << "  file      none (summary files are written on internal builds)\n";
  for (const auto& file : files) out << "  file      " << file << "\n";
  return 0;
}

namespace {

// Appends "name value" rows for every number in `stats`, nested names joined by dots.
void FlattenStats(const Dictionary& stats, const std::string& prefix,
                  std::vector<std::pair<std::string, std::string>>& rows) {
  for (const auto& [key, value] : stats) {
    const std::string name = prefix + key.Description();
    if (const Dictionary* nested = value.as_dictionary()) {
      FlattenStats(*nested, name + ".", rows);
    } else {
      rows.emplace_back(name, value.Description());
    }
  }
}

}  // namespace

std::variant<DaemonStats, std::string> ReadDaemonStats(const Paths& paths) {
  const std::string path = paths.runtime_dir + "/" + kStatsFileName;
  DaemonStats read;
  if (auto error = ReadSmallFile(path, 1 << 20, read.text)) {
    if (error->code == ENOENT) return "qnreportingd is not running (there is no " + path + ")";
    return error->Description();
  }
  Value stats;
  if (ParseJson(read.text, stats) || !stats.as_dictionary()) return path + " is not a stats file";
  read.stats = *stats.as_dictionary();
  const Value* pid = read.stats.Find("pid");
  const auto number = pid ? pid->as_int64() : std::nullopt;
  if (number && *number > 0 && ::kill(static_cast<pid_t>(*number), 0) != 0 && errno == ESRCH) {
    return "qnreportingd is not running (" + path + " is from process " + std::to_string(*number) +
           ", which has ended)";
  }
  return read;
}

int RunStats(const Paths& paths, bool json, std::ostream& out, std::ostream& err) {
  auto read = ReadDaemonStats(paths);
  if (const auto* problem = std::get_if<std::string>(&read)) {
    err << "qnreport: " << *problem << "\n";
    return kExitFailure;
  }
  const DaemonStats& stats = std::get<DaemonStats>(read);
  if (json) {
    out << stats.text;
    return 0;
  }
  std::vector<std::pair<std::string, std::string>> rows;
  FlattenStats(stats.stats, "", rows);
  const Value* store = stats.stats.Find("store");
  const Value* oldest =
      store && store->as_dictionary() ? store->as_dictionary()->Find("oldest_row_time") : nullptr;
  if (oldest && oldest->as_double()) {
    const double age = Date::Now().seconds_since_1970 - *oldest->as_double();
    rows.emplace_back("store.oldest_row_age",
                      std::to_string(static_cast<std::int64_t>(age)) + " s");
  }
  std::size_t width = 0;
  for (const auto& row : rows) width = std::max(width, row.first.size());
  for (const auto& [name, value] : rows) {
    out << name << std::string(width + 2 - name.size(), ' ') << value << "\n";
  }
  out << "status: " << LinuxStatsPublisher::StatusLine(stats.stats) << "\n";
  return 0;
}

}  // namespace qn::qnreport
