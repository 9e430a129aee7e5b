#include "tests/e2e/Daemon.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <thread>

#include "common/Json.h"
#include "tests/store/store_test_util.h"

extern char** environ;
constexpr const char* kIpcDomain = "com.norvel.quenta.ipc";

namespace qn::e2e {

namespace {

// argv / envp for posix_spawn: the parent's environment without the variables through which
// systemd talks to a service, so that the daemon never mistakes the test's for its own.
std::vector<char*> Pointers(std::vector<std::string>& strings) {
  std::vector<char*> out;
  for (auto& s : strings) out.push_back(s.data());
  out.push_back(nullptr);
  return out;
}
std::vector<std::string> ChildEnvironment() {
  std::vector<std::string> out;
  for (char** entry = environ; entry && *entry; ++entry) {
    const std::string e = *entry;
    const std::string name = e.substr(0, e.find('='));
    if (name != "NOTIFY_SOCKET" && name != "JOURNAL_STREAM" && !name.starts_with("LISTEN_")) {
      out.push_back(e);
    }
  }
  return out;
}

ExitStatus FromWaitStatus(int status) {
  if (WIFEXITED(status)) return ExitStatus{true, WEXITSTATUS(status)};
  if (WIFSIGNALED(status)) return ExitStatus{false, WTERMSIG(status)};
  return ExitStatus{};
}

}  // namespace

// --- ChildProcess ------------------------------------------------------------------------

ChildProcess::ChildProcess(const std::string& binary, const std::vector<std::string>& args,
                           const std::string& dir, int stderr_fd)
    : stdout_path_(dir + "/stdout.txt"), stderr_path_(dir + "/stderr.txt") {
  std::vector<std::string> argv_strings{binary};
  argv_strings.insert(argv_strings.end(), args.begin(), args.end());
  std::vector<std::string> env_strings = ChildEnvironment();
  std::vector<char*> argv = Pointers(argv_strings);
  std::vector<char*> envp = Pointers(env_strings);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 1, stdout_path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                   0644);
  if (stderr_fd >= 0) {
    posix_spawn_file_actions_adddup2(&actions, stderr_fd, 2);
  } else {
    posix_spawn_file_actions_addopen(&actions, 2, stderr_path_.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0644);
  }
  posix_spawnattr_t attributes;
  posix_spawnattr_init(&attributes);
  sigset_t none, all;
  sigemptyset(&none);
  sigfillset(&all);
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setsigdefault(&attributes, &all);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  const int error =
      ::posix_spawn(&pid_, binary.c_str(), &actions, &attributes, argv.data(), envp.data());
  posix_spawnattr_destroy(&attributes);
  posix_spawn_file_actions_destroy(&actions);
  if (error != 0) {
    ADD_FAILURE() << "cannot start " << binary << ": " << std::strerror(error);
    pid_ = -1;
    return;
  }
  pidfd_ = static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0));
}

ChildProcess::~ChildProcess() {
  if (pid_ > 0 && !status_) {
    ::kill(pid_, SIGKILL);
    Wait(kPatience);
  }
  if (pidfd_ >= 0) ::close(pidfd_);
}

bool ChildProcess::running() { return pid_ > 0 && !Wait(std::chrono::milliseconds(0)); }

void ChildProcess::Signal(int signal) const {
  if (pid_ > 0 && !status_) ::kill(pid_, signal);
}

std::optional<ExitStatus> ChildProcess::Wait(std::chrono::milliseconds timeout) {
  if (pid_ <= 0 || status_) return status_;
  // The pidfd becomes readable when the process ends.
  pollfd p{pidfd_, POLLIN, 0};
  int status = 0;
  if (::poll(&p, 1, static_cast<int>(timeout.count())) == 1 &&
      ::waitpid(pid_, &status, 0) == pid_) {
    status_ = FromWaitStatus(status);
  }
  return status_;
}

std::string ChildProcess::Stdout() const { return testing::ReadFileText(stdout_path_); }
std::string ChildProcess::Stderr() const { return testing::ReadFileText(stderr_path_); }

// --- Daemon ------------------------------------------------------------------------------

Daemon::Daemon(std::vector<std::string> extra_args, std::optional<std::string> socket,
               int stderr_fd, std::string home_dir)
    : home_path_(home_dir.empty() ? home_.path() : home_dir),
      socket_path_(socket.value_or(home_path_ + "/run/reporting.sock")) {
  std::vector<std::string> args{"--home", home()};
  if (socket) args.insert(args.end(), {"--socket", *socket});
  args.insert(args.end(), extra_args.begin(), extra_args.end());
  process_ = std::make_unique<ChildProcess>(QN_DAEMON_PATH, args, home(), stderr_fd);
  // The socket exists once the daemon listens; until then connecting fails.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (std::chrono::steady_clock::now() < deadline) {
    if (!process_->running()) {
      ADD_FAILURE() << "qnreportingd exited early: " << process_->Stderr();
      return;
    }
    if (auto probe = client::Client::Connect(socket_path())) {
      started_ = probe->getAllReportersSync().has_value();
      if (!started_) ADD_FAILURE() << "qnreportingd did not answer: " << process_->Stderr();
      return;
    }
    std::this_thread::sleep_for(5ms);
  }
  ADD_FAILURE() << "qnreportingd never accepted a connection: " << process_->Stderr();
}

std::unique_ptr<client::Client> Daemon::Connect() {
  std::string error;
  auto client = client::Client::Connect(socket_path(), &error);
  if (!client) ADD_FAILURE() << "connect: " << error;
  return client;
}

std::unique_ptr<testing::RawConnection> Daemon::ConnectAs(uid_t uid) {
  ::chmod(home().c_str(), 0750);  // mkdtemp's 0700 would keep the child out
  auto raw = std::make_unique<testing::RawConnection>("");
  const pid_t child = ::fork();
  if (child == 0) {  // connects the socket it shares with the parent, as `uid` of group root
    _exit(::setgroups(0, nullptr) == 0 && ::setuid(uid) == 0 && raw->Connect(socket_path()) ? 0
                                                                                            : 1);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  if (status != 0) ADD_FAILURE() << "no connection as uid " << uid;
  return status == 0 ? std::move(raw) : nullptr;
}

std::size_t Daemon::PeakRss() const {
  const auto status = testing::ReadFileText("/proc/" + std::to_string(process_->pid()) + "/status");
  const auto at = status.find("VmHWM:");
  return at == std::string::npos ? 0 : std::stoull(status.substr(at + 6)) * 1024;
}

std::optional<ExitStatus> Daemon::Stop(int signal) {
  process_->Signal(signal);
  return process_->Wait();
}

std::vector<ReportingStoreRow> Daemon::Rows(std::optional<ReportingSink> sink) const {
  return testing::ReadRows(db_path(), sink);
}

bool Eventually(const std::function<bool()>& condition) {
  for (const auto deadline = std::chrono::steady_clock::now() + kPatience; !condition();) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
  return true;
}

bool Daemon::WaitForRows(
    const std::function<bool(const std::vector<ReportingStoreRow>&)>& condition) {
  return Eventually([&] { return condition(Rows()); });
}

bool Daemon::WaitForStat(const std::vector<const char*>& path, std::int64_t least) {
  return Eventually([&] {
    Value stats = Json(testing::ReadFileText(home() + "/run/stats.json"));
    const Value* at = &stats;
    for (const char* key : path)
      at = at && at->as_dictionary() ? at->as_dictionary()->Find(key) : nullptr;
    return at && at->as_int64().value_or(0) >= least;
  });
}

std::vector<std::string> NamesIn(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ec)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

std::vector<ReportingStoreRow> RowsOf(const std::vector<ReportingStoreRow>& rows,
                                      ReportingStoreRow::Table table) {
  std::vector<ReportingStoreRow> out;
  for (const auto& row : rows)
    if (row.table == table) out.push_back(row);
  return out;
}

std::int64_t ErrorCode(const Value& frame) {
  const Array* a = frame.as_array();
  const Dictionary* body =
      a && a->size() == 2 && a->front() == Value(0) ? a->back().as_dictionary() : nullptr;
  const bool ok = body && body->Find("domain") && *body->Find("domain") == Value(kIpcDomain) &&
                  body->Find("message") && body->Find("message")->is_string();
  return ok && body->Find("code") ? body->Find("code")->as_int64().value_or(-1) : -1;
}

Value Json(const std::string& text) {
  Value value;
  if (ParseJson(text, value)) return Value();
  return value;
}

std::vector<ReportingStoreRow> AnalyticsNamed(const std::vector<ReportingStoreRow>& rows,
                                              const std::string& name) {
  std::vector<ReportingStoreRow> out;
  for (const auto& row : RowsOf(rows, ReportingStoreRow::Table::kAnalyticsEvent)) {
    if (row.name == name) out.push_back(row);
  }
  return out;
}

}  // namespace qn::e2e
