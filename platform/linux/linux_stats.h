#pragma once

#include <string>

#include "common/Value.h"

namespace qn {

// Publishes the daemon's counters: as JSON in a file that `qnreport stats` reads, and as
// a one-line STATUS for `systemctl status` (sd_notify; nothing when not under systemd).
// Not thread-safe: one thread publishes (the daemon's signal thread, once a second).
class LinuxStatsPublisher {
 public:
  // REQUIRES: the folder of `path` exists.
  explicit LinuxStatsPublisher(std::string path) : path_(std::move(path)) {}

  // Writes `stats` (atomically: a reader never sees half a file) and its status line,
  // unless they are what was published last. A file that cannot be written is tried again
  // at the next call (the status line is still sent).
  void Publish(const Dictionary& stats);

  // The status line of `stats`, e.g. "3 connections, 12 sessions, 1204 messages, store
  // lag 0, 2 paused, 0 dropped", with ", export lag 0" (or ", export lag 40 (unreachable)"
  // while not connected) when the daemon exports.
  static std::string StatusLine(const Dictionary& stats);

 private:
  const std::string path_;
  std::string last_;
};

// The stats file's name in the daemon's runtime folder.
inline constexpr const char* kStatsFileName = "stats.json";

}  // namespace qn
