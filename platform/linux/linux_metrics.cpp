#include "platform/linux/linux_metrics.h"

#include <cstdio>
#include <optional>
#include <string_view>

namespace qn {
namespace {

// How a figure of the stats file is exposed. A `label` means the figure is a dictionary
// whose keys become that label's values; no `name` means it is not exposed at all.
struct Family {
  std::string_view path;
  const char* name;
  const char* type;
  const char* help;
  const char* label = nullptr;
};

constexpr Family kFamilies[] = {
    {"pid", nullptr, nullptr, nullptr},
    {"requests", "requests_total", "counter", "Requests accepted, by operation.", "op"},
    {"messages", "messages_total", "counter", "Messages accepted (sendMessage requests)."},
    {"bad_frames", "bad_frames_total", "counter",
     "Frames refused as bad input, by connection error code.", "code"},
    {"paused", "paused_total", "counter",
     "Times a connection stopped being read, by reason (flow control).", "reason"},
    {"refused", "refused_total", "counter", "What the limits refused, by limit.", "limit"},
    {"aggregation_capped", "aggregation_capped_total", "counter",
     "Payloads delivered but left out of their session's summary (aggregation cap)."},
    {"log_lines_dropped", "log_lines_dropped_total", "counter",
     "Log lines dropped because the log's stream was full or gone."},
    {"connections_open", "connections", "gauge", "Client connections open."},
    {"sessions_open", "sessions", "gauge", "Reporting sessions open."},
    {"deliveries_queued", "deliveries_queued", "gauge",
     "Messages handed to sessions and not yet handed to the store."},
    {"aggregated_bytes", "aggregated_bytes", "gauge",
     "Payload bytes the sessions hold for their summaries."},
    {"store.committed", "store_rows_committed_total", "counter",
     "Rows the reporting store committed."},
    {"store.failed", "store_rows_failed_total", "counter",
     "Rows the reporting store could not write."},
    {"store.dropped_queue_full", "store_rows_dropped_total", "counter",
     "Rows dropped because the store's queue was full."},
    {"store.lag", "store_lag_rows", "gauge",
     "Rows handed to the reporting store and not yet written."},
    {"store.batches", "store_batches_total", "counter",
     "Batches (transactions) the reporting store committed."},
    {"store.lag_bytes", "store_lag_bytes", "gauge",
     "Payload bytes handed to the reporting store and not yet written."},
    {"store.removed", "store_rows_removed_total", "counter", "Rows retention removed."},
    {"store.lost", "store_rows_lost_total", "counter",
     "Rows retention removed before an exporter had shipped them."},
    {"store.bytes_on_disk", "store_bytes_on_disk", "gauge", "Size of the store's file."},
    {"store.oldest_row_time", "store_oldest_row_timestamp_seconds", "gauge",
     "Time of the store's oldest row (seconds since 1970)."},
    {"configuration_capped", "configuration_capped_total", "counter",
     "Session configurations acknowledged but not merged (configuration cap)."},
    {"configuration_bytes", "configuration_bytes", "gauge",
     "Configuration bytes the sessions hold."},
    {"parked_bytes", "parked_bytes", "gauge",
     "Payload bytes of single messages waiting in delay timers."},
    {"summary_files_removed", "summary_files_removed_total", "counter",
     "Summary files removed to keep their folder within its limits."},
    {"export.published", "export_published_total", "counter", "Rows published for export."},
    {"export.acknowledged", "export_acknowledged_total", "counter",
     "Exported rows the stream acknowledged (duplicates included)."},
    {"export.duplicates", "export_duplicates_total", "counter",
     "Exported rows the stream already held."},
    {"export.errors", "export_errors_total", "counter", "Export publishes that failed."},
    {"export.resends", "export_resends_total", "counter", "Export publishes sent again."},
    {"export.lag_rows", "export_lag_rows", "gauge", "Committed rows not yet exported."},
    {"export.lag_seconds", "export_lag_seconds", "gauge",
     "Age of the oldest row not yet exported."},
    {"export.connected", "export_connected", "gauge", "1 while the exporter is connected."},
};

constexpr const char* kPrefix = "qnreportingd_";

// The sample value of a number or a bool; nullopt for anything else.
std::optional<std::string> SampleValue(const Value& value) {
  if (const auto n = value.as_int64()) return std::to_string(*n);
  if (const auto n = value.as_uint64()) return std::to_string(*n);
  if (!value.is_number() && !value.is_bool()) return std::nullopt;
  char text[32];
  std::snprintf(text, sizeof text, "%.17g", *value.as_double());
  return std::string(text);
}

// A metric name from a stats path: letters, digits and underscores only.
std::string MetricName(std::string_view path) {
  std::string name = kPrefix;
  for (const char c : path) {
    const bool keep = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
    name.push_back(keep ? c : '_');
  }
  return name;
}

// A label value with backslashes, quotes and newlines escaped.
std::string LabelValue(const std::string& text) {
  std::string escaped;
  for (const char c : text) {
    if (c == '\\') {
      escaped += "\\\\";
    } else if (c == '"') {
      escaped += "\\\"";
    } else if (c == '\n') {
      escaped += "\\n";
    } else {
      escaped.push_back(c);
    }
  }
  return escaped;
}

void Header(std::string& out, const std::string& name, const char* type, const std::string& help) {
  out += "# HELP " + name + " " + help + "\n# TYPE " + name + " " + type + "\n";
}

void Append(std::string& out, const Dictionary& stats, const std::string& prefix) {
  for (const auto& [key, value] : stats) {
    const std::string path = prefix + key.Description();
    const Family* family = nullptr;
    for (const Family& known : kFamilies) {
      if (known.path == path) family = &known;
    }
    if (family && !family->name) continue;
    const Dictionary* nested = value.as_dictionary();
    if (family && family->label && nested) {
      const std::string name = kPrefix + std::string(family->name);
      Header(out, name, family->type, family->help);
      for (const auto& [labelValue, sample] : *nested) {
        // Operations by the first part of their name: "sendMessage", not the whole
        // "sendMessage:withCategory:andType:forReportingIDs:reply:".
        std::string label = labelValue.Description();
        label = label.substr(0, label.find(':'));
        if (const auto text = SampleValue(sample)) {
          out += name + "{" + family->label + "=\"" + LabelValue(label) + "\"} " + *text + "\n";
        }
      }
    } else if (nested) {
      Append(out, *nested, path + ".");
    } else if (const auto text = SampleValue(value)) {
      const std::string name = family ? kPrefix + std::string(family->name) : MetricName(path);
      Header(out, name, family ? family->type : "untyped",
             family ? family->help : "The daemon's stats figure " + path + ".");
      out += name + " " + *text + "\n";
    }
  }
}

}  // namespace

std::string PrometheusText(const Dictionary& stats) {
  std::string out;
  Append(out, stats, "");
  return out;
}

}  // namespace qn
