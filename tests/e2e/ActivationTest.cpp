// The daemon as systemd starts it: systemd-socket-activate listens on the socket and starts
// qnreportingd only when the first client connects, passing the listening socket.
#include <gtest/gtest.h>

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <thread>

#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

constexpr const char* kActivator = "/usr/bin/systemd-socket-activate";

// A datagram socket bound at `path`, where the daemon's readiness notification arrives.
int NotificationSocket(const std::string& path) {
  const int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// Every notification that arrives within `timeout`, joined by newlines.
std::string Notifications(int fd, std::chrono::milliseconds timeout) {
  std::string all;
  pollfd p{fd, POLLIN, 0};
  while (::poll(&p, 1, static_cast<int>(timeout.count())) == 1) {
    char buffer[512];
    const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    if (n <= 0) break;
    all.append(buffer, static_cast<std::size_t>(n)).push_back('\n');
    if (all.find("READY=1\n") != std::string::npos) break;
  }
  return all;
}

TEST(SocketActivationTest, TheFirstConnectionStartsTheDaemonWhichAnswersAndNotifies) {
  if (::access(kActivator, X_OK) != 0) GTEST_SKIP() << kActivator << " is not installed";
  testing::TempDir home;
  const std::string socket = home.path() + "/activated.sock";
  const int notify = NotificationSocket(home.path() + "/notify.sock");
  ASSERT_GE(notify, 0);
  ChildProcess activator(
      kActivator,
      {"--listen=" + socket, "--setenv=NOTIFY_SOCKET=" + home.path() + "/notify.sock",
       QN_DAEMON_PATH, "--home", home.path()},
      home.path());
  for (auto deadline = std::chrono::steady_clock::now() + kPatience;
       !std::filesystem::exists(socket) && std::chrono::steady_clock::now() < deadline;) {
    std::this_thread::sleep_for(5ms);
  }
  ASSERT_TRUE(std::filesystem::exists(socket)) << activator.Stderr();
  // Nothing has started the daemon yet: it creates its store when it starts.
  EXPECT_FALSE(std::filesystem::exists(home.path() + "/state/reports.db"));

  auto client = client::Client::Connect(socket);
  ASSERT_TRUE(client);
  EXPECT_EQ(client->createReportingSessionSync(7), true) << activator.Stderr();
  EXPECT_NE(Notifications(notify, kPatience).find("READY=1\n"), std::string::npos);
  EXPECT_TRUE(std::filesystem::exists(home.path() + "/state/reports.db"));
  client.reset();

  // The activator has become the daemon, which the socket's owner stops with SIGTERM.
  activator.Signal(SIGTERM);
  EXPECT_EQ(activator.Wait(), Exited(0)) << activator.Stderr();
  ::close(notify);
}

}  // namespace
}  // namespace qn::e2e
