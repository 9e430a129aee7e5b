#pragma once

#include <cstdint>
#include <optional>
#include <ostream>
#include <string>
#include <variant>

#include "common/Paths.h"
#include "common/Value.h"
#include "platform/linux/reporting_store_reader.h"

namespace qn::qnreport {

// The administration commands, which work on the daemon's folders directly and need no
// connection. Each writes its output to `out` and its complaints to `err`, and returns
// the process exit status (0 success, 1 failure). Arguments arrive checked by the
// command line.

// defaults read: the daemon's defaults suite ("com.norvel.quenta") as pretty JSON.
int RunDefaultsRead(const Paths& paths, std::ostream& out, std::ostream& err);
// defaults write KEY VALUE: VALUE is read as JSON when it is JSON (true, 0, "text", {...}),
// else as a plain string (YES).
int RunDefaultsWrite(const Paths& paths, const std::string& key, const std::string& value,
                     std::ostream& err);
// defaults delete KEY (deleting a key that is not there succeeds).
int RunDefaultsDelete(const Paths& paths, const std::string& key, std::ostream& err);
// notify post NAME: posts a system-wide notification to every process watching it.
int RunNotifyPost(const Paths& paths, const std::string& name, std::ostream& err);

// orientation ui VALUE: posts VALUE as the UI orientation. orientation (ui nullopt): prints
// the device orientation the daemon follows and the UI orientation last posted ("none" for
// either when there is none), one "device: ..." and one "ui: ..." line.
int RunOrientation(const Paths& paths, const std::optional<std::string>& ui, std::ostream& out,
                   std::ostream& err);

struct EventsOptions {
  ReportingRowFilter filter;
  bool json = false;    // one JSON object per row instead of aligned columns
  bool follow = false;  // after the rows there are, print new ones as they arrive
};
// events: the rows of the reporting store, oldest first, one per line. With `follow` it
// returns only when `out` fails (the reader went away).
int RunEvents(const Paths& paths, const EventsOptions& options, std::ostream& out,
              std::ostream& err);

// session N: one framework session's story: start and stop, message counts by category and
// type, the summary event, the driver-statistics change and the summary file.
int RunSession(const Paths& paths, std::int64_t session, std::ostream& out, std::ostream& err);

// The daemon's stats file as it is now: its text and its dictionary.
struct DaemonStats {
  std::string text;
  Dictionary stats;
};
// Reads the stats file the daemon writes at start-up and then once a second when its
// counters change. Returns the one-line reason when there are no stats of a running
// daemon: "qnreportingd is not running (...)" when the file is missing or was left by a
// daemon that has ended (its "pid" is gone), or what is wrong with the file.
std::variant<DaemonStats, std::string> ReadDaemonStats(const Paths& paths);

// stats: the daemon's counters, one "name value" line each and the status line, or the
// file's JSON as it is. Says in one line on `err` (status 1) when the daemon is not running.
int RunStats(const Paths& paths, bool json, std::ostream& out, std::ostream& err);

// A time given on the command line: "2026-11-21 13:05[:SS]", "2026-11-21", "13:05[:SS]"
// (today), "-90s" / "-15m" / "-2h" / "-1d" (before `now`), or seconds since the epoch.
// Local time. Returns nullopt when the text is none of these.
std::optional<double> ParseTimeArgument(const std::string& text, double now);

}  // namespace qn::qnreport
