// qnreportingd: the quenta reporting daemon.
//
// Builds the platform from the Linux implementations, creates the service delegate, takes
// the listening socket (from systemd socket activation, or a path it binds itself) and
// serves clients until SIGTERM or SIGINT (or until a client asks it to exit). SIGHUP makes
// it re-read its defaults.

#include <pthread.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

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
#include "platform/linux/linux_trace.h"
#include "platform/linux/reporting_store.h"
#include "platform/linux/store_sinks.h"
#include "platform/platform.h"

#ifndef QN_VERSION
#define QN_VERSION "0.1.0"
#endif

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

constexpr const char* kUsage =
    R"(Usage: qnreportingd [OPTIONS]

The quenta reporting daemon. Audio clients connect to it over a Unix socket (through
libqnreporting or the qnreport tool) to open reporting sessions, send messages and stop
them; the daemon aggregates each session, sends a summary when it stops and hands
everything to its reporting store (SQLite), its analytics sink and its power log. Under
systemd it is started on demand by qnreportingd.socket.

Options:
  --home DIR           keep everything under DIR: the socket and notifications in
                       DIR/run, the store and the defaults in DIR/state, summary files
                       in DIR/log
  --socket PATH        listen on PATH instead of <runtime>/reporting.sock (ignored when
                       systemd passes a listening socket)
  --internal-build     behave as on an internal build (summary files, orientation)
  --device-info FILE   device answers as a JSON object (default
                       /etc/quenta/device-info.json)
  --driver-stats DIR   driver statistics counters: DIR/<group>/<subgroup>/<channel>
                       files holding one integer (default <runtime>/driver-stats)
  --debug SCOPES       write debug lines of these log scopes: "qnrs" (service),
                       "qnrr" (sessions), "qnrd" (driver statistics), separated by
                       commas, or "all"
  --help               show this text and exit
  --version            show the version and exit

Folders without --home: root uses /run/quenta, /var/lib/quenta and /var/log/quenta;
other users $XDG_RUNTIME_DIR/quenta, $XDG_STATE_HOME/quenta and <state>/log.
Files: <state>/reports.db (the store), <state>/defaults/com.norvel.quenta.json (the
defaults), <log>/DiagnosticLogs/Audio/Reporting (summary files, internal builds).

Talking to it:
  qnreport [--home DIR] shell            one operation per line, replies as JSON
  qnreport [--home DIR] events           what the store holds
  qnreport [--home DIR] defaults write disable_reporting YES
  systemctl reload qnreportingd          (or SIGHUP) re-read the defaults

Signals: SIGHUP re-reads the defaults; SIGTERM and SIGINT close the socket, stop every
client's sessions, write out the store and exit with status 0. A client's killService
request ends the daemon with status 2.
)";

struct Options {
  PathOptions paths;
  bool internal_build = false;
  std::string device_info = kDefaultDeviceInfo;
  std::optional<std::string> driver_stats;
  std::string debug_scopes;
};

enum class ParseOutcome { kRun, kHelp, kVersion, kError };

// Parses the command line into `options`; `error` explains a kError.
ParseOutcome ParseArguments(int argc, char** argv, Options& options, std::string& error) {
  for (int i = 1; i < argc; ++i) {
    std::string_view arg = argv[i];
    std::optional<std::string> inline_value;
    if (arg.starts_with("--")) {
      if (auto eq = arg.find('='); eq != std::string_view::npos) {
        inline_value = std::string(arg.substr(eq + 1));
        arg = arg.substr(0, eq);
      }
    }
    auto value = [&](std::string& out) {
      if (inline_value) {
        out = *inline_value;
      } else if (i + 1 < argc) {
        out = argv[++i];
      } else {
        error = std::string(arg) + " needs a value";
        return false;
      }
      if (out.empty()) {
        error = std::string(arg) + " needs a non-empty value";
        return false;
      }
      return true;
    };
    auto no_value = [&] {
      if (!inline_value) return true;
      error = std::string(arg) + " takes no value";
      return false;
    };

    std::string text;
    if (arg == "--help" || arg == "-h") {
      if (!no_value()) return ParseOutcome::kError;
      return ParseOutcome::kHelp;
    } else if (arg == "--version") {
      if (!no_value()) return ParseOutcome::kError;
      return ParseOutcome::kVersion;
    } else if (arg == "--home") {
      if (!value(text)) return ParseOutcome::kError;
      options.paths.home = text;
    } else if (arg == "--socket") {
      if (!value(text)) return ParseOutcome::kError;
      options.paths.socket = text;
    } else if (arg == "--internal-build") {
      if (!no_value()) return ParseOutcome::kError;
      options.internal_build = true;
    } else if (arg == "--device-info") {
      if (!value(text)) return ParseOutcome::kError;
      options.device_info = text;
    } else if (arg == "--driver-stats") {
      if (!value(text)) return ParseOutcome::kError;
      options.driver_stats = text;
    } else if (arg == "--debug") {
      if (!value(text)) return ParseOutcome::kError;
      options.debug_scopes = text;
    } else {
      error = "unknown argument: " + std::string(argv[i]);
      return ParseOutcome::kError;
    }
  }
  return ParseOutcome::kRun;
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
  for (const auto& [dir, mode] :
       {std::pair{paths.runtime_dir, mode_t{0755}}, std::pair{paths.state_dir, mode_t{0750}},
        std::pair{paths.log_dir, mode_t{0750}}}) {
    if (auto failure = CreateDirectories(dir, mode)) {
      std::fprintf(stderr, "%s: cannot create %s: %s\n", kProgram, dir.c_str(),
                   failure->Description().c_str());
      return 1;
    }
  }

  LinuxLogOptions log_options;
  log_options.debug_scopes = options.debug_scopes;
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
  platform->log = log;
  platform->trace = NewLinuxTrace();
  platform->dispatcher = NewLinuxDispatcher();
  platform->notify = NewLinuxNotify({.runtime_dir = paths.runtime_dir, .log = log});
  platform->defaults = NewLinuxDefaults({.state_dir = paths.state_dir, .log = log});
  platform->diagnostic_logs_dir = paths.log_dir + "/DiagnosticLogs/Audio/Reporting";
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

  std::shared_ptr<QNReportingServiceDelegate> delegate =
      QNReportingServiceDelegate::Create(platform);

  LinuxIpcOptions ipc_options;
  ipc_options.socket_path = paths.socket_path;
  LinuxIpcListenerResult listening =
      NewLinuxIpcListener(ipc_options, log, delegate->context().logScope);
  if (!listening.listener) {
    std::fprintf(stderr, "%s: cannot listen on %s: %s\n", kProgram, paths.socket_path.c_str(),
                 listening.error.c_str());
    store->Drain();
    return 1;
  }
  std::shared_ptr<IpcListener> listener = listening.listener;
  listener->SetDelegate(delegate);

  // The one thread that takes the handled signals (blocked everywhere else).
  std::shared_ptr<Notify> notify = platform->notify;
  std::thread signals([listener, notify, log] {
    const sigset_t set = HandledSignals();
    for (;;) {
      int signal = 0;
      if (sigwait(&set, &signal) != 0) continue;
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

  qn::Options options;
  std::string error;
  switch (qn::ParseArguments(argc, argv, options, error)) {
    case qn::ParseOutcome::kHelp:
      std::fputs(qn::kUsage, stdout);
      return 0;
    case qn::ParseOutcome::kVersion:
      std::printf("%s %s\n", qn::kProgram, QN_VERSION);
      return 0;
    case qn::ParseOutcome::kError:
      std::fprintf(stderr, "%s: %s\nTry 'qnreportingd --help' for more information.\n",
                   qn::kProgram, error.c_str());
      return 2;
    case qn::ParseOutcome::kRun:
      break;
  }
  return qn::Run(options);
}
