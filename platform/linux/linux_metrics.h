#pragma once

#include <string>

#include "common/Value.h"

namespace qn {

// The daemon's stats (the dictionary the stats file holds) in the Prometheus text
// exposition format, for node_exporter's textfile collector. Every number in `stats`
// becomes a sample named "qnreportingd_<path>", with "# HELP" and "# TYPE" lines:
// the figures the daemon is known to keep get their Prometheus names, types and labels
// (counters end in "_total", e.g. qnreportingd_requests_total{op="sendMessage"}; gauges
// do not, e.g. qnreportingd_connections); any other number (a figure added to the stats
// later) appears as an untyped sample named by its path ("export.lag_rows" ->
// qnreportingd_export_lag_rows). Strings and arrays are left out.
std::string PrometheusText(const Dictionary& stats);

}  // namespace qn
