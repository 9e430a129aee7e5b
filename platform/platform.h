#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>

#include "common/Counters.h"
#include "platform/analytics.h"
#include "platform/defaults.h"
#include "platform/device_info.h"
#include "platform/dispatch.h"
#include "platform/enerdex.h"
#include "platform/livo_reporting.h"
#include "platform/log.h"
#include "platform/notify.h"
#include "platform/orientation.h"
#include "platform/ostrel.h"
#include "platform/process.h"
#include "platform/trace.h"

namespace qn {

// Every platform service the service logic uses, in one place (like LevelDB's Env): the
// daemon fills it with the Linux implementations, tests with fakes. Members are set once,
// before the service starts, and only read afterwards.
struct Platform {
  std::shared_ptr<Log> log;
  std::shared_ptr<Trace> trace;
  std::shared_ptr<Dispatcher> dispatcher;
  std::shared_ptr<Notify> notify;
  std::shared_ptr<Defaults> defaults;
  std::shared_ptr<Process> process;
  std::shared_ptr<DeviceInfo> device_info;
  std::shared_ptr<LivoReporting> livo_reporting;
  std::shared_ptr<Orientation> orientation;
  std::shared_ptr<Ostrel> ostrel;
  std::shared_ptr<Enerdex> enerdex;
  std::shared_ptr<Analytics> analytics;

  // The diagnostic-log directory for audio reporting (summary files), below the daemon's
  // log folder `log_dir`. The log folder is trusted as it is; every folder below it is made
  // (0750) and opened relative to the one above, never through a symbolic link, and refused
  // when another user owns it (common/Files.h, OpenOwnFolder).
  std::string log_dir = "/var/log/quenta";
  std::string diagnostic_logs_dir = "/var/log/quenta/DiagnosticLogs/Audio/Reporting";
  // The most summary files, and bytes of them, the folder keeps; after each write the
  // oldest go first.
  std::size_t max_summary_files = kDefaultMaxSummaryFiles;
  static constexpr std::size_t kDefaultMaxSummaryFiles = 1000;
  std::uint64_t max_summary_bytes = kDefaultMaxSummaryBytes;
  static constexpr std::uint64_t kDefaultMaxSummaryBytes = 64u << 20;
  // The one serial queue that writes summary files, in the order sessions stop, off the
  // thread that stops them. A stop reply is sent only after the queue has run the write
  // that stop queued. Null: a session writes its file on the thread that stops it.
  std::shared_ptr<SerialQueue> summary_queue;
  // Where the service counts what it took in and refused (`qnreport stats`). Never null.
  std::shared_ptr<Counters> counters = std::make_shared<Counters>();
  // The payload bytes (Value::ApproximateBytes) one session aggregates for its summary
  // while started. A payload beyond it is still delivered, only left out of the summary, so
  // one client cannot grow the daemon's memory without end.
  std::size_t max_aggregated_bytes = kDefaultMaxAggregatedBytes;
  static constexpr std::size_t kDefaultMaxAggregatedBytes = 2u << 20;
  // The same for all sessions together (counted in counters->aggregatedBytes).
  std::size_t max_aggregated_bytes_total = kDefaultMaxAggregatedBytesTotal;
  static constexpr std::size_t kDefaultMaxAggregatedBytesTotal = 32u << 20;
  // The configuration bytes (user info, Value::ApproximateBytes) one session keeps, the
  // sessions of one uid (counted in its HeldBytes), and all sessions together (counted in
  // counters->configurationBytes). A configuration that would pass any is acknowledged but
  // not merged.
  std::size_t max_configuration_bytes = 64u << 10;
  std::size_t max_configuration_bytes_per_uid = 4u << 20;
  std::size_t max_configuration_bytes_total = 8u << 20;

  // Process-wide state that is computed once (the internal-build flag). It lives here so
  // that each test's Platform starts afresh.
  mutable std::once_flag internal_build_once;
  mutable bool internal_build = false;
};

}  // namespace qn
