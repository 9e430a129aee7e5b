// What the daemon was handed survives a kill -9 under load, and the daemon as systemd
// starts it: socket activation with its readiness notification.
#include <gtest/gtest.h>
#include <poll.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <set>

#include "tests/e2e/Daemon.h"
#include "tests/store/store_test_util.h"

namespace qn::e2e {
namespace {

// The "n" of every message row in the store at `db`.
std::set<std::int64_t> StoredNumbers(const std::string& db) {
  std::set<std::int64_t> numbers;
  for (const auto& row : RowsOf(testing::ReadRows(db), ReportingStoreRow::Table::kLivoMessage)) {
    const Value payload = Json(row.payload);
    const Value* n = payload.as_dictionary() ? payload.as_dictionary()->Find("n") : nullptr;
    if (n && n->as_int64()) numbers.insert(*n->as_int64());
  }
  return numbers;
}

std::string IntegrityCheck(const std::string& db) {
  sqlite3* handle = nullptr;
  std::string result = "cannot open";
  if (sqlite3_open_v2(db.c_str(), &handle, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_stmt* stmt = nullptr;
    sqlite3_prepare_v2(handle, "PRAGMA integrity_check", -1, &stmt, nullptr);
    result = sqlite3_step(stmt) == SQLITE_ROW
                 ? reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0))
                 : sqlite3_errmsg(handle);
    sqlite3_finalize(stmt);
  }
  sqlite3_close(handle);
  return result;
}

// kill -9 while pipelined messages pour in: what was committed before stays, the database
// is intact, and the restarted daemon serves and writes.
TEST(DurabilityTest, KillNineUnderLoadLosesNoCommittedRowAndTheRestartServes) {
  testing::TempDir home;
  const std::string db = home.File("state/reports.db");
  auto daemon = StartOn(home, {});
  ASSERT_TRUE(daemon->started());
  auto client = daemon->Connect();
  ASSERT_TRUE(client);
  ASSERT_EQ(client->createReportingSessionSync(1), true);
  client->startReportingSessionForID(1, nullptr);
  constexpr int kRounds = 12, kPerRound = 500;
  std::set<std::int64_t> committed;
  for (std::int64_t n = 0; n < kRounds * kPerRound; ++n) {
    Value message(Dictionary{{"n", n}});
    if ((n + 1) % kPerRound != 0) {
      client->sendMessage(message, 1, 1, std::vector<std::int64_t>{1}, nullptr);
      continue;
    }
    // A round ends with a reply awaited; the replies to the round came before it.
    ASSERT_TRUE(RepliedWithoutError(client->sendMessageSync(message, 1, 1, {{1}})));
    if (n + 1 == kRounds * kPerRound / 2) committed = StoredNumbers(db);
  }
  daemon->process().Signal(SIGKILL);
  ASSERT_EQ(daemon->process().Wait(), (ExitStatus{false, SIGKILL}));
  client.reset();
  EXPECT_EQ(IntegrityCheck(db), "ok");
  const std::set<std::int64_t> stored = StoredNumbers(db);
  EXPECT_FALSE(committed.empty());
  EXPECT_TRUE(std::includes(stored.begin(), stored.end(), committed.begin(), committed.end()));

  auto restarted = StartOn(home, {});
  ASSERT_TRUE(restarted->started());
  auto again = restarted->Connect();
  ASSERT_TRUE(again);
  ASSERT_EQ(again->createReportingSessionSync(2), true);
  again->startReportingSessionForID(2, nullptr);
  const std::int64_t after = kRounds * kPerRound;
  EXPECT_TRUE(RepliedWithoutError(
      again->sendMessageSync(Value(Dictionary{{"n", after}}), 1, 1, std::vector<std::int64_t>{2})));
  again.reset();
  EXPECT_EQ(restarted->Stop(), Exited(0));
  const std::set<std::int64_t> final_rows = StoredNumbers(db);
  EXPECT_TRUE(final_rows.count(after));
  EXPECT_TRUE(std::includes(final_rows.begin(), final_rows.end(), stored.begin(), stored.end()));
  EXPECT_EQ(IntegrityCheck(db), "ok");
}

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
  ASSERT_TRUE(Eventually([&] { return std::filesystem::exists(socket); })) << activator.Stderr();
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
