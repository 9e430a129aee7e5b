#pragma once

#include <optional>
#include <ostream>

#include "common/Paths.h"

namespace qn::qnreport {

struct TopOptions {
  double interval = 1;        // seconds between refreshes
  std::optional<long> count;  // refreshes before it ends; none: until q or Ctrl-C
  int terminal = -1;          // the terminal's descriptor when standard output is one
};

// top: a live view of the daemon's stats file, which it follows with inotify: rates per
// second (requests by operation, messages, store rows committed, pauses, refusals), the
// gauges (connections, sessions, deliveries queued, aggregated bytes, store lag, export
// lag when the file has one) and a sparkline of messages per second, one column per
// refresh. On a terminal the screen is redrawn in place (the alternate screen) until `q`,
// Ctrl-C, SIGTERM or `count` refreshes; the terminal is then left as it was. Otherwise
// it writes one plain line per refresh to `out`. Returns 1 with one line on `err` when
// the daemon is not running at the start, else 0.
int RunTop(const Paths& paths, const TopOptions& options, std::ostream& out, std::ostream& err);

}  // namespace qn::qnreport
