#include "tools/qnreport/Admin.h"

#include <cmath>
#include <ctime>
#include <optional>
#include <ostream>

#include "common/Json.h"
#include "platform/linux/linux_defaults.h"
#include "platform/linux/linux_notify.h"
#include "platform/linux/reporting_store_reader.h"

namespace qn::qnreport {
namespace {

constexpr const char* kSuite = "com.norvel.quenta";
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

int Usage(std::ostream& err, const std::string& problem) {
  err << "qnreport: " << problem << "\nTry 'qnreport --help'.\n";
  return kExitUsage;
}

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

// The row as a line for people: time, what it is, and its payload.
std::string RowText(const ReportingStoreRow& row) {
  std::string line = LocalTime(row.time) + "  ";
  switch (row.table) {
    case ReportingStoreRow::Table::kLivoSession:
      line += "session " + std::to_string(row.id) + " " + row.user_info;
      if (row.flushed) line += "  (flushed " + LocalTime(*row.flushed) + ")";
      return line;
    case ReportingStoreRow::Table::kLivoMessage:
      line += row.session ? "session " + std::to_string(*row.session) : std::string("single");
      line += "  category " + std::to_string(row.category) + " type " + std::to_string(row.type) +
              "  " + row.payload;
      return line;
    case ReportingStoreRow::Table::kAnalyticsEvent:
      return line + "analytics " + row.name + "  " + row.payload;
    case ReportingStoreRow::Table::kPowerLogEvent:
      return line + "powerlog " + std::to_string(row.subsystem) + " " + row.name + "  " +
             row.payload;
  }
  return line;
}

}  // namespace

int RunDefaults(const Paths& paths, const std::vector<std::string>& args, std::ostream& out,
                std::ostream& err) {
  const std::string verb = args.empty() ? "" : args[0];
  if (verb == "read" && args.size() == 1) {
    Dictionary suite;
    if (auto error = ReadSuite(paths.state_dir, kSuite, suite)) {
      return Failure(err, "reading the defaults", *error);
    }
    out << ToJsonLenient(Value(std::move(suite)), JsonStyle::kPretty) << "\n";
    return 0;
  }
  if (verb == "write" && args.size() == 3) {
    Value value;
    if (ParseJson(args[2], value)) value = Value(args[2]);  // not JSON: a plain string
    if (auto error = WriteDefault(paths.state_dir, kSuite, args[1], value)) {
      return Failure(err, "writing " + args[1], *error);
    }
    return 0;
  }
  if (verb == "delete" && args.size() == 2) {
    if (auto error = DeleteDefault(paths.state_dir, kSuite, args[1])) {
      return Failure(err, "deleting " + args[1], *error);
    }
    return 0;
  }
  return Usage(err, "defaults takes: write KEY VALUE | delete KEY | read");
}

int RunNotify(const Paths& paths, const std::vector<std::string>& args, std::ostream&,
              std::ostream& err) {
  if (args.size() != 2 || args[0] != "post" || args[1].empty()) {
    return Usage(err, "notify takes: post NAME");
  }
  if (std::uint32_t status = PostNotification(paths.runtime_dir, args[1]); status != 0) {
    err << "qnreport: posting " << args[1] << " failed (status " << status << ")\n";
    return kExitFailure;
  }
  return 0;
}

int RunEvents(const Paths& paths, const std::vector<std::string>& args, std::ostream& out,
              std::ostream& err) {
  std::optional<ReportingSink> sink;
  bool json = false;
  for (std::size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "--json") {
      json = true;
    } else if (args[i] == "--sink" && i + 1 < args.size()) {
      sink = ParseReportingSink(args[++i]);
      if (!sink) return Usage(err, "--sink takes reporting, analytics or powerlog");
    } else {
      return Usage(err, "events takes: [--sink reporting|analytics|powerlog] [--json]");
    }
  }
  std::optional<Error> error;
  auto reader = ReportingStoreReader::Open(paths.state_dir + "/reports.db", &error);
  if (!reader) return Failure(err, "opening " + paths.state_dir + "/reports.db", *error);
  error = reader->ForEachRow(sink, [&](const ReportingStoreRow& row) {
    out << (json ? RowJson(row) : RowText(row)) << "\n";
    return static_cast<bool>(out);
  });
  if (error) return Failure(err, "reading the store", *error);
  return 0;
}

}  // namespace qn::qnreport
