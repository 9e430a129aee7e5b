#include "platform/linux/linux_stats.h"

#include <systemd/sd-daemon.h>

#include "common/Files.h"
#include "common/Json.h"
#include "platform/linux/linux_metrics.h"

namespace qn {
namespace {

// The integer at `path` ("a.b") in `stats`, or 0.
std::int64_t Number(const Dictionary& stats, std::initializer_list<const char*> path) {
  const Dictionary* level = &stats;
  const Value* found = nullptr;
  for (const char* key : path) {
    if (!level) return 0;
    found = level->Find(key);
    if (!found) return 0;
    level = found->as_dictionary();
  }
  return found ? found->as_int64().value_or(0) : 0;
}

// ", export lag N" (and why nothing moves, when not connected), or nothing without export.
std::string ExportPart(const Dictionary& stats) {
  const Value* found = stats.Find("export");
  const Dictionary* figures = found ? found->as_dictionary() : nullptr;
  if (!figures) return std::string();
  std::string part = ", export lag " + std::to_string(Number(*figures, {"lag_rows"}));
  const Value* connected = figures->Find("connected");
  const Value* state = figures->Find("state");
  if (!(connected && *connected == Value(true)) && state && state->as_string()) {
    part += " (" + std::string(*state->as_string()) + ")";
  }
  return part;
}

}  // namespace

std::string LinuxStatsPublisher::StatusLine(const Dictionary& stats) {
  const std::int64_t paused = Number(stats, {"paused", "requests"}) +
                              Number(stats, {"paused", "replies"}) +
                              Number(stats, {"paused", "store"});
  const std::int64_t dropped = Number(stats, {"store", "failed"}) +
                               Number(stats, {"store", "dropped_queue_full"}) +
                               Number(stats, {"log_lines_dropped"});
  return std::to_string(Number(stats, {"connections_open"})) + " connections, " +
         std::to_string(Number(stats, {"sessions_open"})) + " sessions, " +
         std::to_string(Number(stats, {"messages"})) + " messages, store lag " +
         std::to_string(Number(stats, {"store", "lag"})) + ", " + std::to_string(paused) +
         " paused, " + std::to_string(dropped) + " dropped" + ExportPart(stats);
}

std::optional<Error> LinuxStatsPublisher::Publish(const Dictionary& stats) {
  std::string text = ToJsonLenient(Value(stats), JsonStyle::kPretty);
  if (text == last_) return std::nullopt;
  text.push_back('\n');
  // Readable by all: admins who are not the daemon's user run qnreport stats and top, and
  // node_exporter reads the metrics (the daemon's umask would make both 0600).
  std::optional<Error> error = WriteFileAtomically(path_, text, 0644);
  if (!error && !metrics_path_.empty()) {
    error = WriteFileAtomically(metrics_path_, PrometheusText(stats), 0644);
  }
  text.pop_back();
  if (!error) last_ = std::move(text);
  sd_notify(0, ("STATUS=" + StatusLine(stats)).c_str());
  return error;
}

}  // namespace qn
