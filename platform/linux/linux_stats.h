#pragma once

#include <optional>
#include <string>

#include "common/Error.h"
#include "common/Value.h"

namespace qn {

// Publishes the daemon's counters: as JSON in a file that `qnreport stats` and `qnreport
// top` read, optionally in the Prometheus text format in a second file, and as a one-line
// STATUS for `systemctl status` (sd_notify; nothing when not under systemd).
// Not thread-safe: one thread publishes (the daemon's signal thread, once a second).
class LinuxStatsPublisher {
 public:
  // `metrics_path`, when not empty, is the Prometheus file. REQUIRES: the folder of `path`
  // exists.
  explicit LinuxStatsPublisher(std::string path, std::string metrics_path = "")
      : path_(std::move(path)), metrics_path_(std::move(metrics_path)) {}

  // Writes `stats` and its metrics (each file atomically: a reader never sees half a file)
  // and its status line, unless they are what was published last. Files that cannot be
  // written are tried again at the next call (the status line is still sent); the error
  // of the first that failed is returned.
  std::optional<Error> Publish(const Dictionary& stats);

  // The status line of `stats`, e.g. "3 connections, 12 sessions, 1204 messages, store
  // lag 0, 2 paused, 0 dropped", with ", export lag 0" (or ", export lag 40 (unreachable)"
  // while not connected) when the daemon exports.
  static std::string StatusLine(const Dictionary& stats);

 private:
  const std::string path_;
  const std::string metrics_path_;
  std::string last_;
};

// The stats file's name in the daemon's runtime folder.
inline constexpr const char* kStatsFileName = "stats.json";

}  // namespace qn
