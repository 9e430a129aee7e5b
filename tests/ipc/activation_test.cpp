// Socket activation and readiness notification, each run in a child process: they need
// file descriptor 3 and the LISTEN_* / NOTIFY_SOCKET variables, which belong to the process.

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>

#include "qnreporting/Client.h"
#include "tests/ipc/ipc_test_util.h"

namespace qn::testing {
namespace {

// Runs `body` in a child process; the child's exit status is the step that failed (0: none).
int InChild(const std::function<int()>& body) {
  std::fflush(nullptr);
  const pid_t pid = ::fork();
  if (pid == 0) std::_Exit(body());
  int status = 0;
  ::waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 100 + WTERMSIG(status);
}

// Puts `fd` at SD_LISTEN_FDS_START (3) as systemd would, with LISTEN_FDS / LISTEN_PID.
bool PassAsActivated(int fd) {
  if (::dup2(fd, 3) != 3) return false;
  ::setenv("LISTEN_FDS", "1", 1);
  ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
  return true;
}

TEST(LinuxIpcActivationTest, TakesTheSocketSystemdPassesAndNotifiesReadiness) {
  TempDir dir;
  const std::string activated = dir.path() + "/activated.sock";
  const std::string notify = dir.path() + "/notify.sock";
  const int status = InChild([&]() -> int {
    int listening = BindUnixSocket(SOCK_STREAM, activated);
    if (listening < 0 || ::listen(listening, 8) != 0) return 1;
    if (!PassAsActivated(listening)) return 2;
    int notifications = BindUnixSocket(SOCK_DGRAM, notify);
    if (notifications < 0) return 3;
    ::setenv("NOTIFY_SOCKET", notify.c_str(), 1);

    LinuxIpcOptions options;
    options.socket_path = dir.path() + "/not-used.sock";  // activation wins
    auto made = NewLinuxIpcListener(options, std::make_shared<LogCapture>());
    if (!made.listener) return 4;
    made.listener->SetDelegate(std::make_shared<FakeDelegate>());
    std::thread thread([&] { made.listener->Resume(); });

    char buffer[256] = {};
    const ssize_t n = ::recv(notifications, buffer, sizeof buffer - 1, 0);
    const bool ready = n > 0 && std::string(buffer, static_cast<std::size_t>(n)) == "READY=1";
    auto client = client::Client::Connect(activated);
    const bool served = client && client->createReportingSessionSync(1) == true;
    client.reset();
    made.listener->Stop();
    thread.join();
    if (!ready) return 5;
    if (!served) return 6;
    if (::access(options.socket_path.c_str(), F_OK) == 0) return 7;  // nothing bound there
    if (::access(activated.c_str(), F_OK) != 0) return 8;            // systemd's socket file stays
    return 0;
  });
  EXPECT_EQ(status, 0);
}

TEST(LinuxIpcActivationTest, PassedSocketThatDoesNotListenIsRefused) {
  TempDir dir;
  const std::string path = dir.path() + "/datagram.sock";
  const int status = InChild([&]() -> int {
    int datagram = BindUnixSocket(SOCK_DGRAM, path);
    if (datagram < 0 || !PassAsActivated(datagram)) return 1;
    LinuxIpcOptions options;
    options.socket_path = dir.path() + "/fallback.sock";
    options.notify_ready = false;
    auto made = NewLinuxIpcListener(options, std::make_shared<LogCapture>());
    if (made.listener) return 2;
    if (made.error.find("none a listening Unix stream socket") == std::string::npos) return 3;
    return 0;
  });
  EXPECT_EQ(status, 0);
}

}  // namespace
}  // namespace qn::testing
