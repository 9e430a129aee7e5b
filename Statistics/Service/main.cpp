// qnreportingd: the quenta reporting daemon.
//
// Builds the platform from the Linux implementations, creates the service delegate, takes
// the listening socket (from systemd socket activation, or a path it binds itself) and
// serves clients until SIGTERM or SIGINT (or until a client asks it to exit). SIGHUP makes
// it re-read its defaults.

#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include <CLI/CLI.hpp>

#include "Statistics/Service/QNReportingServiceDelegate.h"
#include "Statistics/Service/QNReportingSession.h"
#include "common/Files.h"
#include "common/Paths.h"
#include "platform/linux/export/device_id.h"
#include "platform/linux/export/nats_exporter.h"
#include "platform/linux/linux_defaults.h"
#include "platform/linux/linux_device_info.h"
#include "platform/linux/linux_dispatch.h"
#include "platform/linux/linux_ipc.h"
#include "platform/linux/linux_log.h"
#include "platform/linux/linux_notify.h"
#include "platform/linux/linux_orientation.h"
#include "platform/linux/linux_ostrel.h"
#include "platform/linux/linux_process.h"
#include "platform/linux/linux_stats.h"
#include "platform/linux/linux_trace.h"
#include "platform/linux/reporting_store.h"
#include "platform/linux/store/retention.h"
#include "platform/linux/store_sinks.h"
#include "platform/platform.h"

#ifndef QN_VERSION
#define QN_VERSION "0.1.0"
#endif

// jemalloc's settings (read by the allocator at start-up; harmless without it): a
// background thread hands memory freed after a burst back to the system within a second or
// two, instead of keeping it until later allocations happen to purge it.
extern "C" const char* malloc_conf;
const char* malloc_conf = "background_thread:true,dirty_decay_ms:1000,muzzy_decay_ms:0";

namespace qn {
namespace {

constexpr const char* kProgram = "qnreportingd";
constexpr const char* kDefaultDeviceInfo = "/etc/quenta/device-info.json";
// How long an orderly shutdown waits for the sessions' queued work (a session start may
// wait up to 9 s for its backends).
constexpr auto kSessionDrainTimeout = std::chrono::seconds(12);
// How long it waits for the server queue to run the connection-end steps.
constexpr auto kServerQueueDrainTimeout = std::chrono::seconds(30);
// How long an exit waits for the summary files still queued (each is one small fsynced file).
constexpr auto kSummaryDrainTimeout = std::chrono::seconds(10);

constexpr const char* kDescription =
    "The quenta reporting daemon. Audio clients connect to it over a Unix socket (through\n"
    "libqnreporting or the qnreport tool) to open reporting sessions, send messages and stop\n"
    "them; the daemon aggregates each session, sends a summary when it stops and hands\n"
    "everything to its reporting store (SQLite), its analytics sink and its power log. Under\n"
    "systemd it is started on demand by qnreportingd.socket.";

constexpr const char* kFooter = R"(
Folders: with --home DIR, DIR/run (socket, notifications), DIR/state (store, defaults) and
DIR/log (summary files). Without --home root uses /run/quenta, /var/lib/quenta and
/var/log/quenta; other users $XDG_RUNTIME_DIR/quenta (without it they need --home),
$XDG_STATE_HOME/quenta and <state>/log; under systemd the unit's folders. Each must belong
to the daemon's user and be writable by no one else.
Files: <state>/reports.db (the store), <state>/defaults/com.norvel.quenta.json (the
defaults), <log>/DiagnosticLogs/Audio/Reporting (summary files, internal builds).

Talking to it:
  qnreport [--home DIR] shell            one operation per line, replies as JSON
  qnreport [--home DIR] events           what the store holds
  qnreport [--home DIR] defaults write disable_reporting YES
  systemctl reload qnreportingd          (or SIGHUP) re-read the defaults

Signals: SIGHUP re-reads the defaults; SIGTERM and SIGINT close the socket, stop every
client's sessions, write out the store and exit with status 0. A client's killService
request ends the daemon with status 2. See qnreportingd(8).
)";

// What one client may hold and how far the daemon reads ahead (docs/daemon.md, "Limits").
struct Limits {
  std::size_t max_connections = LinuxIpcOptions{}.max_connections;
  std::size_t max_sessions_per_uid = QNReportingServerContext::kDefaultMaxSessionsPerUid;
  std::size_t max_sessions = QNReportingServerContext::kDefaultMaxSessions;
  std::size_t max_aggregated_bytes = Platform::kDefaultMaxAggregatedBytes;
  std::size_t max_aggregated_bytes_total = Platform::kDefaultMaxAggregatedBytesTotal;
  std::size_t max_pending_requests = LinuxIpcOptions{}.max_pending_requests;
  std::size_t max_pending_bytes = LinuxIpcOptions{}.max_pending_request_bytes;
  std::size_t max_unread_reply_bytes = LinuxIpcOptions{}.max_outgoing_bytes;
  std::size_t store_high_water = 1024;
  // Per uid and byte budgets (docs/daemon.md, "Who may do what").
  std::size_t max_reporter_ids = LinuxIpcOptions{}.max_reporter_ids;
  std::size_t max_connections_per_uid = LinuxIpcOptions{}.max_connections_per_uid;
  std::array<IpcByteBudget, kIpcBudgetCount> ipc_budgets = LinuxIpcOptions{}.budgets;
  std::size_t partial_frame_timeout_s = LinuxIpcOptions{}.partial_frame_timeout_ms / 1000;
  std::size_t store_high_water_bytes = 16u << 20;
  std::size_t max_store_bytes_per_uid = LinuxIpcOptions{}.max_store_bytes_per_uid;
  std::size_t max_parked_bytes = 8u << 20;
  std::size_t max_parked_bytes_per_uid = LinuxIpcOptions{}.max_parked_bytes_per_uid;
  std::size_t max_configuration_bytes = Platform{}.max_configuration_bytes;
  std::size_t max_configuration_bytes_per_uid = Platform{}.max_configuration_bytes_per_uid;
  std::size_t max_configuration_bytes_total = Platform{}.max_configuration_bytes_total;
  std::size_t max_summary_files = Platform::kDefaultMaxSummaryFiles;
  std::size_t max_summary_bytes = Platform::kDefaultMaxSummaryBytes;
};

struct Options {
  PathOptions paths;
  bool internal_build = false;
  std::string device_info = kDefaultDeviceInfo;
  std::optional<std::string> driver_stats;
  std::string debug_scopes;
  Limits limits;
  std::string metrics_file;       // the counters for Prometheus too, when set
  ReportingStore::Options store;  // its retention: --store-max-bytes, --store-max-age
  bool shared_sessions = false;
  NatsExportOptions export_nats;  // export is on when it names servers
};

// A CLI11 check that a value is not empty.
const CLI::Validator kNotEmpty(
    [](std::string& text) { return text.empty() ? std::string("needs a non-empty value") : ""; },
    "");

// The log scopes --debug names, separated by commas.
const CLI::Validator kDebugScopes(
    [](std::string& text) {
      std::string_view rest = text;
      while (!rest.empty()) {
        const std::string_view scope = rest.substr(0, rest.find(','));
        if (scope != "qnrs" && scope != "qnrr" && scope != "qnrd" && scope != "all") {
          return "unknown log scope \"" + std::string(scope) + "\" (qnrs, qnrr, qnrd or all)";
        }
        rest.remove_prefix(std::min(rest.size(), scope.size() + 1));
      }
      return std::string();
    },
    "");

// The command line. Returns the exit status when the program should end now (help,
// version, a usage error), nullopt when it should run with `options`.
std::optional<int> ParseCommandLine(int argc, char** argv, Options& options) {
  CLI::App app(kDescription, kProgram);
  app.footer(kFooter);
  // An option given twice takes the last value, as the command-line convention goes.
  app.option_defaults()->multi_option_policy(CLI::MultiOptionPolicy::TakeLast);
  app.set_help_flag("-h,--help", "Show this text and exit");
  app.set_version_flag("--version", std::string(kProgram) + " " + QN_VERSION,
                       "Show the version and exit");
  app.add_option("--home", options.paths.home,
                 "Keep the socket, store, defaults and logs under DIR")
      ->type_name("DIR")
      ->check(kNotEmpty);
  app.add_option("--socket", options.paths.socket,
                 "Listen on PATH (unless systemd passes a socket)")
      ->type_name("PATH")
      ->check(kNotEmpty);
  app.add_flag("--internal-build", options.internal_build,
               "Behave as an internal build: write summary files")
      ->disable_flag_override();
  app.add_option("--device-info", options.device_info, "Device answers, a JSON object")
      ->type_name("FILE")
      ->default_str(kDefaultDeviceInfo)
      ->check(kNotEmpty);
  app.add_option("--driver-stats", options.driver_stats,
                 "Driver counters: DIR/group/subgroup/channel")
      ->type_name("DIR")
      ->default_str("<runtime>/driver-stats")
      ->check(kNotEmpty);
  app.add_option("--debug", options.debug_scopes, "Debug lines of qnrs, qnrr, qnrd (commas) or all")
      ->type_name("SCOPES")
      ->check(kNotEmpty)
      ->check(kDebugScopes);
  app.add_option("--metrics-file", options.metrics_file,
                 "Also write the counters to PATH for Prometheus (node_exporter's textfile "
                 "collector)")
      ->type_name("PATH")
      ->check(kNotEmpty);
  app.add_flag("--shared-sessions", options.shared_sessions,
               "Let every client reach every other client's sessions, whatever its user")
      ->disable_flag_override();
  Limits& limits = options.limits;
  const auto limit = [&app](const char* name, std::size_t& value, const char* what,
                            std::size_t most = SIZE_MAX) {
    // A whole number from 1 to `most` (the validator's own text would clutter --help).
    const CLI::Validator in_range(
        [most](std::string& text) {
          std::size_t parsed = 0;
          const bool whole = !text.empty() &&
                             text.find_first_not_of("0123456789") == std::string::npos &&
                             CLI::detail::lexical_cast(text, parsed);
          if (whole && parsed >= 1 && parsed <= most) return std::string();
          return most == SIZE_MAX ? std::string("needs a positive whole number")
                                  : "needs a whole number from 1 to " + std::to_string(most);
        },
        "");
    app.add_option(name, value, what)
        ->type_name("N")
        ->default_val(value)
        ->check(in_range)
        ->group("Limits");
  };
  limit("--max-connections", limits.max_connections,
        "Connections open at once (one more is refused)");
  limit("--max-sessions-per-uid", limits.max_sessions_per_uid,
        "Sessions the clients of one user may hold");
  limit("--max-sessions", limits.max_sessions, "Sessions all clients may hold (at most 100000)",
        QNReportingServerContext::kMostMaxSessions);
  limit("--max-aggregated-bytes", limits.max_aggregated_bytes,
        "Payload bytes a session keeps for its summary");
  limit("--max-aggregated-bytes-total", limits.max_aggregated_bytes_total,
        "The same for all sessions together");
  limit("--max-pending-requests", limits.max_pending_requests,
        "Requests of one connection in the service at once");
  limit("--max-pending-bytes", limits.max_pending_bytes, "Bytes of those requests");
  limit("--max-unread-reply-bytes", limits.max_unread_reply_bytes,
        "Reply bytes a client may leave unread (not read from 1/8 on)");
  limit("--store-high-water", limits.store_high_water,
        "Messages waiting for the store before senders are held back");
  // The store's retention, in journald's forms: a size (K, M, G, T) and a duration.
  const CLI::Validator byte_size(
      [](std::string& text) {
        return store::ParseByteSize(text) ? std::string() : "needs a size such as 512M or 4G";
      },
      "");
  const CLI::Validator duration(
      [](std::string& text) {
        return store::ParseDuration(text) ? std::string() : "needs a duration such as 30d or 12h";
      },
      "");
  app.add_option_function<std::string>(
         "--store-max-bytes",
         [&options](const std::string& text) {
           options.store.max_bytes = store::ParseByteSize(text);
         },
         "Largest size of the store's file, oldest rows removed beyond it (0: no limit)")
      ->type_name("SIZE")
      ->default_str("10% of its file system, at most 4G")
      ->check(byte_size)
      ->group("Limits");
  app.add_option_function<std::string>(
         "--store-max-age",
         [&options](const std::string& text) {
           options.store.max_age_seconds = store::ParseDuration(text).value_or(0);
         },
         "Rows older than this are removed (exported ones only)")
      ->type_name("DURATION")
      ->default_str("off")
      ->check(duration)
      ->group("Limits");
  limit("--max-reporter-ids", limits.max_reporter_ids, "Reporter IDs in one request's list");
  limit("--max-connections-per-uid", limits.max_connections_per_uid,
        "Connections one user may hold open");
  limit("--max-request-bytes-per-uid", limits.ipc_budgets[kIpcRequestBytes].per_uid,
        "Bytes of requests in the service, one user's");
  limit("--max-request-bytes-total", limits.ipc_budgets[kIpcRequestBytes].total,
        "The same for all users");
  limit("--max-frame-bytes-per-uid", limits.ipc_budgets[kIpcFrameBytes].per_uid,
        "Bytes read but not yet handed over (partial frames), one user's");
  limit("--max-frame-bytes-total", limits.ipc_budgets[kIpcFrameBytes].total,
        "The same for all users");
  limit("--max-reply-bytes-per-uid", limits.ipc_budgets[kIpcReplyBytes].per_uid,
        "Reply bytes not yet read, one user's");
  limit("--max-reply-bytes-total", limits.ipc_budgets[kIpcReplyBytes].total,
        "The same for all users");
  limit("--partial-frame-timeout", limits.partial_frame_timeout_s,
        "Seconds a connection may hold a partial frame (at most 86400)", 86400);
  limit("--store-high-water-bytes", limits.store_high_water_bytes,
        "Payload bytes waiting for the store before senders are held back");
  limit("--max-store-bytes-per-uid", limits.max_store_bytes_per_uid,
        "The same for one user's messages (only that user's senders are held back)");
  limit("--max-parked-bytes", limits.max_parked_bytes,
        "Payload bytes of delayed single messages before senders are held back");
  limit("--max-parked-bytes-per-uid", limits.max_parked_bytes_per_uid,
        "The same for one user's messages");
  limit("--max-configuration-bytes", limits.max_configuration_bytes,
        "Configuration bytes a session keeps");
  limit("--max-configuration-bytes-per-uid", limits.max_configuration_bytes_per_uid,
        "The same for all sessions of one user");
  limit("--max-configuration-bytes-total", limits.max_configuration_bytes_total,
        "The same for all sessions together");
  // Export to NATS JetStream (docs/export.md). Each option may also come from the
  // environment (QN_EXPORT_NATS, ...), e.g. the unit's environment file.
  NatsExportOptions& exp = options.export_nats;
  const auto token = [](const char* extra) {
    return CLI::Validator(
        [extra](std::string& text) {
          std::string_view rest = text;
          while (true) {
            const std::string_view part = rest.substr(0, rest.find('.'));
            if (!IsValidDeviceId(part) || (!*extra && part.size() != rest.size())) {
              return std::string("needs letters, digits, '-' or '_'") + extra;
            }
            if (part.size() == rest.size()) return std::string();
            rest.remove_prefix(part.size() + 1);
          }
        },
        "");
  };
  CLI::Option* nats =
      app.add_option("--export-nats", exp.servers, "Export the store to these NATS servers")
          ->type_name("URL[,URL...]")
          ->delimiter(',')
          ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll)
          ->envname("QN_EXPORT_NATS")
          ->check(kNotEmpty)
          ->group("Export");
  const auto export_option = [&](const char* name, std::string& value, const char* what,
                                 const char* env, const char* type) {
    return app.add_option(name, value, what)
        ->type_name(type)
        ->envname(env)
        ->needs(nats)
        ->group("Export");
  };
  export_option("--export-subject", exp.subject_prefix, "Subjects PREFIX.<device>.<kind>",
                "QN_EXPORT_SUBJECT", "PREFIX")
      ->default_str(exp.subject_prefix)
      ->check(token(" (dot-separated)"));
  export_option("--export-stream", exp.stream, "The JetStream stream", "QN_EXPORT_STREAM", "NAME")
      ->default_str(exp.stream)
      ->check(token(""));
  app.add_flag("--export-create-stream", exp.create_stream, "Create the stream when missing")
      ->envname("QN_EXPORT_CREATE_STREAM")
      ->needs(nats)
      ->group("Export");
  app.add_option("--export-replicas", exp.replicas, "Replicas of a stream it creates")
      ->type_name("N")
      ->default_val(1)
      ->check(CLI::Range(1, 5))
      ->envname("QN_EXPORT_REPLICAS")
      ->needs(nats)
      ->group("Export");
  export_option("--export-creds", exp.creds_file, "NATS credentials file", "QN_EXPORT_CREDS",
                "FILE");
  export_option("--export-tls-ca", exp.tls_ca, "CA certificates for TLS", "QN_EXPORT_TLS_CA",
                "FILE");
  export_option("--export-tls-cert", exp.tls_cert, "Client certificate for TLS",
                "QN_EXPORT_TLS_CERT", "FILE");
  export_option("--export-tls-key", exp.tls_key, "Client key for TLS", "QN_EXPORT_TLS_KEY", "FILE");
  export_option("--device-id", exp.device, "This device's ID (default: from the machine ID)",
                "QN_DEVICE_ID", "ID")
      ->check(token(""));
  limit("--max-summary-files", limits.max_summary_files,
        "Summary files kept in their folder (the oldest go first)");
  limit("--max-summary-bytes", limits.max_summary_bytes, "Bytes of summary files kept");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    if (e.get_exit_code() == 0) return app.exit(e);
    std::fprintf(stderr, "%s: %s\nTry 'qnreportingd --help' for more information.\n", kProgram,
                 e.what());
    return 2;
  }
  return std::nullopt;
}

// The signals the daemon handles, blocked in every thread and taken by one waiting thread.
sigset_t HandledSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGHUP);
  return set;
}

// The counters, the store's figures and the exporter's, as the stats file shows them, with
// the daemon's process ID (so that a reader can tell a file left by a daemon that has ended).
Dictionary StatsOf(const Counters& counters, const ReportingStore& store,
                   const NatsExporter* exporter) {
  Dictionary stats = counters.Snapshot();
  stats.Set("pid", Value(static_cast<std::int64_t>(getpid())));
  const ReportingStore::Stats figures = store.stats();
  Dictionary store_stats{{"committed", Value(figures.committed)},
                         {"failed", Value(figures.failed)},
                         {"dropped_queue_full", Value(figures.dropped_queue_full)},
                         {"lag", Value(store.Backlog())},
                         {"lag_bytes", Value(store.BacklogBytes())},
                         {"batches", Value(figures.batches)},
                         {"removed", Value(figures.retention_removed)},
                         {"lost", Value(figures.retention_lost)},
                         {"bytes_on_disk", Value(figures.bytes_on_disk)}};
  // The oldest row's time, not its age: the file then changes only when the store does
  // (qnreport stats shows the age).
  if (figures.oldest_row_time) {
    store_stats.Set("oldest_row_time", Value(static_cast<std::int64_t>(*figures.oldest_row_time)));
  }
  stats.Set("store", Value(std::move(store_stats)));
  if (exporter) stats.Set("export", Value(exporter->Stats()));
  return stats;
}

// Lets the daemon hold as many descriptors as it is allowed (one per connection).
void RaiseDescriptorLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < limit.rlim_max) {
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
  }
}

// Runs `task` on `queue` and waits until it ran, or until `deadline`. Returns whether it ran.
bool RunAndWait(SerialQueue& queue, std::chrono::steady_clock::time_point deadline) {
  auto done = std::make_shared<std::promise<void>>();
  std::future<void> ran = done->get_future();
  queue.Async([done] { done->set_value(); });
  return ran.wait_until(deadline) == std::future_status::ready;
}

// Waits until the summary files queued so far are written (every exit path does).
void WaitForSummaryFiles(SerialQueue& queue, Log& log) {
  if (!RunAndWait(queue, std::chrono::steady_clock::now() + kSummaryDrainTimeout)) {
    QN_LOG(log, nullptr, LogLevel::kError,
           "%s:%d:%s: the summary files were not written in time; exiting anyway");
  }
}

int Run(const Options& options) {
  const Paths paths = ResolvePaths(options.paths);
  if (!paths.problem.empty()) {
    std::fprintf(stderr, "%s: %s; give --home DIR\n", kProgram, paths.problem.c_str());
    return 1;
  }
  // The folders are the daemon's own: one that another user owns or may write to (made
  // first in a shared place, say) could hand the socket or the store to that user.
  // With --home, the folder holding the three must be the daemon's own too.
  std::vector<std::pair<std::string, mode_t>> folders{
      {paths.runtime_dir, 0755}, {paths.state_dir, 0750}, {paths.log_dir, 0750}};
  if (options.paths.home) folders.insert(folders.begin(), {*options.paths.home, 0755});
  for (const auto& [dir, mode] : folders) {
    std::optional<Error> failure = CreateDirectories(dir, mode);
    if (failure) {
      std::fprintf(stderr, "%s: cannot create %s: %s\n", kProgram, dir.c_str(),
                   failure->Description().c_str());
      return 1;
    }
    if ((failure = CheckPrivateFolder(dir))) {
      std::fprintf(stderr, "%s: refusing the folder %s: %s\n", kProgram, dir.c_str(),
                   failure->Description().c_str());
      return 1;
    }
  }

  auto counters = std::make_shared<Counters>();
  LinuxLogOptions log_options;
  log_options.debug_scopes = options.debug_scopes;
  log_options.counters = counters;
  std::shared_ptr<Log> log = NewLinuxLog(log_options);

  std::optional<Error> store_error;
  const std::string store_path = paths.state_dir + "/reports.db";
  std::shared_ptr<ReportingStore> store =
      ReportingStore::Open(store_path, log, options.store, &store_error);
  if (!store) {
    std::fprintf(stderr, "%s: cannot open the reporting store %s: %s\n", kProgram,
                 store_path.c_str(), store_error ? store_error->Description().c_str() : "");
    return 1;
  }

  // The exporter, when configured; it starts before any client can write.
  std::shared_ptr<NatsExporter> exporter;
  if (!options.export_nats.servers.empty()) {
    NatsExportOptions export_options = options.export_nats;
    export_options.db_path = store_path;
    Error error;
    std::optional<std::string> device = export_options.device.empty()
                                            ? ExportDeviceId(paths.state_dir, &error)
                                            : std::optional(export_options.device);
    if (device) {
      export_options.device = *device;
      exporter = NatsExporter::Start(std::move(export_options), log);
    } else {
      QN_LOG(*log, nullptr, LogLevel::kError, "%s:%d:%s: export: no device ID (%s); not exporting",
             error.Description().c_str());
    }
  }

  auto platform = std::make_shared<Platform>();
  platform->counters = counters;
  platform->max_aggregated_bytes = options.limits.max_aggregated_bytes;
  platform->max_aggregated_bytes_total = options.limits.max_aggregated_bytes_total;
  platform->max_configuration_bytes = options.limits.max_configuration_bytes;
  platform->max_configuration_bytes_per_uid = options.limits.max_configuration_bytes_per_uid;
  platform->max_configuration_bytes_total = options.limits.max_configuration_bytes_total;
  platform->log = log;
  platform->trace = NewLinuxTrace();
  platform->dispatcher = NewLinuxDispatcher();
  platform->notify = NewLinuxNotify({.runtime_dir = paths.runtime_dir, .log = log});
  platform->defaults = NewLinuxDefaults({.state_dir = paths.state_dir, .log = log});
  platform->log_dir = paths.log_dir;
  platform->diagnostic_logs_dir = paths.log_dir + "/DiagnosticLogs/Audio/Reporting";
  platform->max_summary_files = options.limits.max_summary_files;
  platform->max_summary_bytes = options.limits.max_summary_bytes;
  // Summary files that an earlier run was writing when it ended: nothing writes there yet.
  if (const std::size_t stale = RemoveTemporaryFiles(platform->diagnostic_logs_dir)) {
    QN_LOG(*log, nullptr, LogLevel::kDefault,
           "%s:%d:%s: removed %lu unfinished summary files of an earlier run",
           static_cast<unsigned long>(stale));
  }
  platform->summary_queue = platform->dispatcher->CreateSerialQueue(
      "com.norvel.quenta.reporting.summaries", QualityOfService::kBackground);
  // killService exits at once; the summary files queued and what was handed to the store
  // are written out first, then the exporter saves how far it got (as at SIGTERM).
  platform->process = NewLinuxProcess(
      [summaries = std::weak_ptr<SerialQueue>(platform->summary_queue),
       drain_store = store->DrainHook(), log, exporting = std::weak_ptr<NatsExporter>(exporter)] {
        if (auto queue = summaries.lock()) WaitForSummaryFiles(*queue, *log);
        drain_store();
        if (auto running = exporting.lock()) running->Stop();
      });
  platform->device_info = NewLinuxDeviceInfo(
      {.path = options.device_info, .internal_build = options.internal_build, .log = log});
  platform->livo_reporting = NewStoreLivoReporting(store);
  platform->orientation = NewLinuxOrientation(
      {.runtime_dir = paths.runtime_dir,
       .log = log,
       .notify = platform->notify,
       .queue = platform->dispatcher->CreateSerialQueue("com.norvel.quenta.reporting.orientation",
                                                        QualityOfService::kBackground)});
  platform->ostrel =
      NewLinuxOstrel(options.driver_stats.value_or(paths.runtime_dir + "/driver-stats"));
  platform->enerdex = NewStoreEnerdex(store);
  platform->analytics = NewStoreAnalytics(store);

  std::shared_ptr<QNReportingServiceDelegate> delegate = QNReportingServiceDelegate::Create(
      platform, {.maxSessionsPerUid = options.limits.max_sessions_per_uid,
                 .maxSessions = options.limits.max_sessions,
                 .sharedSessions = options.shared_sessions});

  auto stats = std::make_shared<LinuxStatsPublisher>(paths.runtime_dir + "/" + kStatsFileName,
                                                     options.metrics_file);
  // Published once before the socket exists: the files are there as soon as a client can
  // connect (and a metrics file that cannot be written is an error at start-up).
  if (auto failure = stats->Publish(StatsOf(*counters, *store, exporter.get()))) {
    std::fprintf(stderr, "%s: cannot write the counters: %s\n", kProgram,
                 failure->Description().c_str());
    store->Drain();
    return 1;
  }

  LinuxIpcOptions ipc_options;
  ipc_options.socket_path = paths.socket_path;
  ipc_options.counters = counters;
  ipc_options.max_connections = options.limits.max_connections;
  ipc_options.max_pending_requests = options.limits.max_pending_requests;
  ipc_options.max_pending_request_bytes = options.limits.max_pending_bytes;
  ipc_options.max_outgoing_bytes = options.limits.max_unread_reply_bytes;
  ipc_options.max_reporter_ids = options.limits.max_reporter_ids;
  ipc_options.max_connections_per_uid = options.limits.max_connections_per_uid;
  ipc_options.budgets = options.limits.ipc_budgets;
  ipc_options.max_store_bytes_per_uid = options.limits.max_store_bytes_per_uid;
  ipc_options.max_parked_bytes_per_uid = options.limits.max_parked_bytes_per_uid;
  ipc_options.partial_frame_timeout_ms =
      static_cast<int>(options.limits.partial_frame_timeout_s * 1000);
  // Messages waiting in the sessions' queues and in the store's queue (counted and in
  // bytes), and single messages waiting in delay timers: above a mark the clients that send
  // messages wait (they are not read), so a slow disk slows them down instead of filling the
  // daemon's memory.
  ipc_options.message_intake_blocked = [store = std::weak_ptr<ReportingStore>(store), counters,
                                        limits = options.limits] {
    auto open = store.lock();
    const std::int64_t queued = Counters::Get(counters->deliveriesQueued);
    return (open ? open->Backlog() : 0) +
                   static_cast<std::uint64_t>(std::max<std::int64_t>(queued, 0)) >
               limits.store_high_water ||
           (open ? open->BacklogBytes() : 0) > limits.store_high_water_bytes ||
           Counters::Get(counters->parkedBytes) >
               static_cast<std::int64_t>(limits.max_parked_bytes);
  };
  LinuxIpcListenerResult listening =
      NewLinuxIpcListener(ipc_options, log, delegate->context().logScope);
  if (!listening.listener) {
    std::fprintf(stderr, "%s: cannot listen on %s: %s\n", kProgram, paths.socket_path.c_str(),
                 listening.error.c_str());
    store->Drain();
    return 1;
  }
  std::shared_ptr<IpcListener> listener = listening.listener;
  store->SetAfterBatch(
      [wake = listening.wake_message_intake, exporting = std::weak_ptr<NatsExporter>(exporter)] {
        wake();
        if (auto open = exporting.lock()) open->Wake();
      });
  listener->SetDelegate(delegate);

  // The one thread that takes the handled signals (blocked everywhere else).
  std::shared_ptr<Notify> notify = platform->notify;
  std::thread signals([listener, notify, log, stats, counters, store, exporter] {
    const sigset_t set = HandledSignals();
    for (;;) {
      // Between signals, once a second, the counters are published.
      const timespec second{1, 0};
      const int signal = sigtimedwait(&set, nullptr, &second);
      if (signal < 0) {
        if (errno == EAGAIN) stats->Publish(StatsOf(*counters, *store, exporter.get()));
        continue;
      }
      if (signal == SIGHUP) {
        notify->Post(kQNReportingDefaultsNotification);
        continue;
      }
      QN_LOG(*log, nullptr, LogLevel::kDefault, "%s:%d:%s: %s received, shutting down",
             signal == SIGINT ? "SIGINT" : "SIGTERM");
      listener->Stop();
      return;
    }
  });

  // Serves until the listener is stopped: no new connections, every connection closed and
  // its connection-end step queued on the server queue.
  listener->Resume();
  signals.join();

  // Let the server queue run the connection-end steps (sessions stopped, clients removed),
  // then the sessions' queues the deliveries and flushes those steps queued.
  if (!RunAndWait(*delegate->context().serverQueue,
                  std::chrono::steady_clock::now() + kServerQueueDrainTimeout)) {
    QN_LOG(*log, nullptr, LogLevel::kError,
           "%s:%d:%s: the server queue did not finish in time; exiting anyway");
  }
  const auto sessions_deadline = std::chrono::steady_clock::now() + kSessionDrainTimeout;
  for (const auto& session : delegate->context().sessions->Alive()) {
    if (!RunAndWait(*session->livoReportingQueue(), sessions_deadline)) {
      QN_LOG(*log, nullptr, LogLevel::kError,
             "%s:%d:%s: session %lli did not finish in time; exiting anyway",
             session->reporterID());
      break;
    }
  }
  WaitForSummaryFiles(*platform->summary_queue, *log);
  store->Drain();

  // Work still queued may hold the platform; the dispatcher is released last, here, so that
  // it is never destroyed from one of its own tasks.
  std::shared_ptr<Dispatcher> dispatcher = platform->dispatcher;
  store->SetAfterBatch(nullptr);
  if (exporter) exporter->Stop();
  listener.reset();
  delegate.reset();
  platform.reset();
  notify.reset();
  dispatcher.reset();
  store->Close();
  return 0;
}

}  // namespace
}  // namespace qn

int main(int argc, char** argv) {
  // Before any thread exists, so that every thread inherits the mask and only the signal
  // thread ever takes these signals.
  const sigset_t handled = qn::HandledSignals();
  pthread_sigmask(SIG_BLOCK, &handled, nullptr);
  // A reader that went away (a client socket, a stderr pipe) is an error to handle where
  // it happens, never a reason to die.
  signal(SIGPIPE, SIG_IGN);

  qn::Options options;
  if (auto status = qn::ParseCommandLine(argc, argv, options)) return *status;
  qn::RaiseDescriptorLimit();
  return qn::Run(options);
}
