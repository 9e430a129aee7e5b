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
  std::size_t max_sessions_per_client = QNReportingServerContext::kDefaultMaxSessionsPerClient;
  std::size_t max_sessions = QNReportingServerContext::kDefaultMaxSessions;
  std::size_t max_aggregated_bytes = Platform::kDefaultMaxAggregatedBytes;
  std::size_t max_aggregated_bytes_total = Platform::kDefaultMaxAggregatedBytesTotal;
  std::size_t max_pending_requests = LinuxIpcOptions{}.max_pending_requests;
  std::size_t max_pending_bytes = LinuxIpcOptions{}.max_pending_request_bytes;
  std::size_t max_unread_reply_bytes = LinuxIpcOptions{}.max_outgoing_bytes;
  std::size_t store_high_water = 4096;
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
  limit("--max-sessions-per-client", limits.max_sessions_per_client,
        "Sessions one client may hold");
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

// The counters and the store's figures, as the stats file shows them.
Dictionary StatsOf(const Counters& counters, const ReportingStore& store) {
  Dictionary stats = counters.Snapshot();
  const ReportingStore::Stats figures = store.stats();
  stats.Set("store", Value(Dictionary{{"committed", Value(figures.committed)},
                                      {"failed", Value(figures.failed)},
                                      {"dropped_queue_full", Value(figures.dropped_queue_full)},
                                      {"lag", Value(store.Backlog())},
                                      {"batches", Value(figures.batches)}}));
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
  std::shared_ptr<ReportingStore> store = ReportingStore::Open(store_path, log, &store_error);
  if (!store) {
    std::fprintf(stderr, "%s: cannot open the reporting store %s: %s\n", kProgram,
                 store_path.c_str(), store_error ? store_error->Description().c_str() : "");
    return 1;
  }

  auto platform = std::make_shared<Platform>();
  platform->counters = counters;
  platform->max_aggregated_bytes = options.limits.max_aggregated_bytes;
  platform->max_aggregated_bytes_total = options.limits.max_aggregated_bytes_total;
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
  // are written out first.
  platform->process =
      NewLinuxProcess([summaries = std::weak_ptr<SerialQueue>(platform->summary_queue),
                       drain_store = store->DrainHook(), log] {
        if (auto queue = summaries.lock()) WaitForSummaryFiles(*queue, *log);
        drain_store();
      });
  platform->device_info = NewLinuxDeviceInfo(
      {.path = options.device_info, .internal_build = options.internal_build, .log = log});
  platform->livo_reporting = NewStoreLivoReporting(store);
  platform->orientation = NewLinuxOrientation();
  platform->ostrel =
      NewLinuxOstrel(options.driver_stats.value_or(paths.runtime_dir + "/driver-stats"));
  platform->enerdex = NewStoreEnerdex(store);
  platform->analytics = NewStoreAnalytics(store);

  std::shared_ptr<QNReportingServiceDelegate> delegate = QNReportingServiceDelegate::Create(
      platform, {.maxSessionsPerClient = options.limits.max_sessions_per_client,
                 .maxSessions = options.limits.max_sessions});

  LinuxIpcOptions ipc_options;
  ipc_options.socket_path = paths.socket_path;
  ipc_options.counters = counters;
  ipc_options.max_connections = options.limits.max_connections;
  ipc_options.max_pending_requests = options.limits.max_pending_requests;
  ipc_options.max_pending_request_bytes = options.limits.max_pending_bytes;
  ipc_options.max_outgoing_bytes = options.limits.max_unread_reply_bytes;
  // Messages waiting in the sessions' queues and in the store's queue: above the mark the
  // clients that send messages wait (they are not read), so a slow disk slows them down
  // instead of filling the daemon's memory.
  ipc_options.message_intake_blocked = [store = std::weak_ptr<ReportingStore>(store), counters,
                                        high_water = options.limits.store_high_water] {
    auto open = store.lock();
    const std::int64_t queued = Counters::Get(counters->deliveriesQueued);
    return (open ? open->Backlog() : 0) +
               static_cast<std::uint64_t>(std::max<std::int64_t>(queued, 0)) >
           high_water;
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
  store->SetAfterBatch(listening.wake_message_intake);
  listener->SetDelegate(delegate);

  // The one thread that takes the handled signals (blocked everywhere else).
  std::shared_ptr<Notify> notify = platform->notify;
  auto stats = std::make_shared<LinuxStatsPublisher>(paths.runtime_dir + "/" + kStatsFileName);
  std::thread signals([listener, notify, log, stats, counters, store] {
    const sigset_t set = HandledSignals();
    for (;;) {
      // Between signals, once a second, the counters are published.
      const timespec second{1, 0};
      const int signal = sigtimedwait(&set, nullptr, &second);
      if (signal < 0) {
        if (errno == EAGAIN) stats->Publish(StatsOf(*counters, *store));
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
