#include "platform/linux/linux_process.h"

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <thread>

#include "common/Format.h"

namespace qn {
namespace {

// The kernel's comm is at most 15 characters plus the terminator; 16 is the hard cap.
constexpr std::size_t kMaxCommBytes = 16;

// Reads the comm file at `path`, trimmed of its trailing newline. The name is the
// process's own choice (prctl PR_SET_NAME), so its control characters are escaped here,
// where every process name the daemon logs or stores comes from.
std::optional<std::string> ReadComm(const char* path) {
  const int fd = ::open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  char buf[kMaxCommBytes + 1];
  ssize_t n;
  do {
    n = ::read(fd, buf, sizeof buf);
  } while (n < 0 && errno == EINTR);
  ::close(fd);
  if (n <= 0) return std::nullopt;
  std::size_t len = static_cast<std::size_t>(n);
  if (buf[len - 1] == '\n') --len;
  if (len > kMaxCommBytes) len = kMaxCommBytes;
  return EscapeControlCharacters(std::string_view(buf, len));
}

class LinuxProcess final : public Process {
 public:
  explicit LinuxProcess(std::function<void()> shutdown) : shutdown_(std::move(shutdown)) {}

  pid_t Pid() const override { return ::getpid(); }

  std::string OwnName() const override {
    if (auto name = ReadComm("/proc/self/comm")) return *name;
    return program_invocation_short_name;
  }

  std::optional<std::string> NameOf(pid_t pid) const override { return ProcessCommandName(pid); }

  [[noreturn]] void Exit(int status) override {
    if (exiting_thread_.load() != std::this_thread::get_id()) {
      exit_mu_.lock();  // never unlocked: whoever gets here first ends the process
      exiting_thread_ = std::this_thread::get_id();
      if (shutdown_) shutdown_();
    }
    std::fflush(nullptr);
    ::_exit(status);
  }

 private:
  const std::function<void()> shutdown_;
  std::mutex exit_mu_;
  std::atomic<std::thread::id> exiting_thread_{};
};

}  // namespace

std::optional<std::string> ProcessCommandName(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  char path[32];
  std::snprintf(path, sizeof path, "/proc/%d/comm", static_cast<int>(pid));
  return ReadComm(path);
}

std::shared_ptr<Process> NewLinuxProcess(std::function<void()> shutdown) {
  return std::make_shared<LinuxProcess>(std::move(shutdown));
}

}  // namespace qn
