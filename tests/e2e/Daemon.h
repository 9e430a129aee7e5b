#pragma once

#include <sys/types.h>

#include <csignal>

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/Value.h"
#include "platform/linux/reporting_store_reader.h"
#include "qnreporting/Client.h"
#include "tests/fakes/RawConnection.h"
#include "tests/fakes/TempDir.h"

namespace qn::e2e {

using namespace std::chrono_literals;

// Generous bounds for things that happen in milliseconds; they only end a hung test.
inline constexpr std::chrono::milliseconds kPatience = 30s;

// Polls `condition` every 10 ms until it holds (true) or kPatience passes (false), for state
// with no event to wait on (rows written after a reply, the stats file, a socket file).
bool Eventually(const std::function<bool()>& condition);

// How a child process ended.
struct ExitStatus {
  bool exited = false;  // by exit(); else by a signal (or not at all within the wait)
  int code = -1;        // the exit status, or the signal number
  bool operator==(const ExitStatus&) const = default;
};
inline ExitStatus Exited(int code) { return {true, code}; }

// Runs `binary` with `args`, its stdout and stderr written to files under `dir` (stderr to
// `stderr_fd` instead when it is given), with the signal mask and dispositions reset and
// without systemd's variables, and waits for it.
class ChildProcess {
 public:
  ChildProcess(const std::string& binary, const std::vector<std::string>& args,
               const std::string& dir, int stderr_fd = -1);
  // Kills the process (SIGKILL) if it still runs.
  ~ChildProcess();

  bool running();
  pid_t pid() const { return pid_; }
  void Signal(int signal) const;
  // Waits for the process to end, at most `timeout`; nullopt when it did not.
  std::optional<ExitStatus> Wait(std::chrono::milliseconds timeout = kPatience);
  std::string Stdout() const;
  std::string Stderr() const;

 private:
  pid_t pid_ = -1;
  int pidfd_ = -1;
  std::optional<ExitStatus> status_;
  std::string stdout_path_;
  std::string stderr_path_;
};

// The real daemon on a temporary --home.
class Daemon {
 public:
  // Starts qnreportingd --home <temp> plus `extra_args` (and --socket `socket` when given),
  // and waits until it accepts connections (by retrying connect; fails the test when it
  // never does or exits). The probe that finds the daemon ready is a client too: it makes
  // one request, so the daemon always lists it, and sends its uptime event when it leaves.
  // `home`, when given, is a folder of the caller's (files can be placed there first).
  explicit Daemon(std::vector<std::string> extra_args = {},
                  std::optional<std::string> socket = std::nullopt, int stderr_fd = -1,
                  std::string home = "");

  const std::string& home() const { return home_path_; }
  const std::string& socket_path() const { return socket_path_; }
  std::string db_path() const { return home() + "/state/reports.db"; }
  ChildProcess& process() { return *process_; }
  bool started() const { return started_; }

  // A new connection (null with a test failure when it cannot connect).
  std::unique_ptr<client::Client> Connect();
  // A raw connection that a forked child running as `uid` (group root, so that it may reach
  // the socket) connected: the daemon sees `uid` as its peer.
  // REQUIRES: the test runs as root.
  std::unique_ptr<testing::RawConnection> ConnectAs(uid_t uid);
  // The daemon's peak resident memory so far (VmHWM), in bytes; 0 when unreadable.
  std::size_t PeakRss() const;

  // Sends `signal` and waits for the daemon to end.
  std::optional<ExitStatus> Stop(int signal = SIGTERM);

  // Every row of the store (all sinks, or one), read now.
  std::vector<ReportingStoreRow> Rows(std::optional<ReportingSink> sink = std::nullopt) const;
  // Reads the rows again until `condition` holds for them, at most kPatience. For rows
  // handed to the store by work that runs after a reply (there is no event to wait on).
  bool WaitForRows(const std::function<bool(const std::vector<ReportingStoreRow>&)>& condition);
  // Waits, at most kPatience, until the stats file the daemon refreshes each second holds
  // at least `least` at `path` (e.g. {"paused", "replies"}).
  bool WaitForStat(const std::vector<const char*>& path, std::int64_t least);

 private:
  testing::TempDir home_;
  std::string home_path_;
  std::string socket_path_;
  std::unique_ptr<ChildProcess> process_;
  bool started_ = false;
};

// The daemon on `home`, with `args`, listening on a socket named by --socket.
inline std::unique_ptr<Daemon> StartOn(const testing::TempDir& home,
                                       std::vector<std::string> args) {
  return std::make_unique<Daemon>(std::move(args), home.File("qn.sock"), -1, home.path());
}
// The names in `dir`, sorted.
std::vector<std::string> NamesIn(const std::string& dir);

// Whether a sendMessageSync result is a reply without an error.
inline bool RepliedWithoutError(const std::optional<std::optional<client::ReplyError>>& result) {
  return result && !*result;
}

// The rows of one table.
std::vector<ReportingStoreRow> RowsOf(const std::vector<ReportingStoreRow>& rows,
                                      ReportingStoreRow::Table table);
// The code of a connection error frame [0, {"domain": "com.norvel.quenta.ipc", "code": N,
// "message": text}]; -1 for any other frame.
std::int64_t ErrorCode(const Value& frame);
// A row's JSON column parsed into a Value (null when it is not JSON).
Value Json(const std::string& text);
// The analytics rows named `name`.
std::vector<ReportingStoreRow> AnalyticsNamed(const std::vector<ReportingStoreRow>& rows,
                                              const std::string& name);

using testing::RawConnection;

}  // namespace qn::e2e
