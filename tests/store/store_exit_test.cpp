// Whatever was handed to the store is in the database after the process ends by _exit after
// the drain hook (the daemon's exit path), by SIGTERM handled with a drain, or by a normal
// exit while the store is still open. Each case runs in a forked child.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>

#include "platform/linux/reporting_store.h"
#include "platform/linux/store_sinks.h"
#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ReadRows;

constexpr int kRows = 10'000;

// Runs `body` in a forked child, which must end the process itself (a return is exit
// status 99). Returns the child's wait status.
int RunChild(const std::function<void()>& body) {
  pid_t pid = fork();
  if (pid == 0) {
    body();
    _exit(99);
  }
  EXPECT_GT(pid, 0);
  int status = 0;
  EXPECT_EQ(waitpid(pid, &status, 0), pid);
  return status;
}

// Opens the store and hands over one framework session with kRows messages, without
// waiting for any of it to be written. Ends the child with status 98 when the store does
// not open.
std::shared_ptr<ReportingStore> HandOverRows(const std::string& path) {
  auto store = ReportingStore::Open(path, nullptr, nullptr);
  if (!store) _exit(98);
  auto livo = NewStoreLivoReporting(store);
  auto session = livo->CreateSession(Dictionary{{"SessionID", 1}}, Dictionary{}, Array{});
  const Value payload(Dictionary{{"key", "value"}, {"n", 1}});
  for (int i = 0; i < kRows; ++i) {
    if (!session->SendMessage(1, 2, payload, nullptr)) _exit(97);
  }
  return store;
}

std::size_t MessageRows(const std::string& path) {
  std::size_t n = 0;
  for (const auto& row : ReadRows(path, ReportingSink::kReporting)) {
    if (row.table == ReportingStoreRow::Table::kLivoMessage) ++n;
  }
  return n;
}

TEST(StoreExitTest, DrainHookThenUnderscoreExitKeepsEverything) {
  testing::TempDir dir;
  const std::string path = dir.File("reports.db");
  int status = RunChild([&] {
    auto store = HandOverRows(path);
    std::function<void()> hook = store->DrainHook();
    hook();
    _exit(2);
  });
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 2);
  EXPECT_EQ(MessageRows(path), static_cast<std::size_t>(kRows));
}

TEST(StoreExitTest, SigtermHandledByDrainingKeepsEverything) {
  testing::TempDir dir;
  const std::string path = dir.File("reports.db");
  int ready[2];
  ASSERT_EQ(pipe(ready), 0);
  pid_t pid = fork();
  if (pid == 0) {
    close(ready[0]);
    // As the daemon does: SIGTERM is taken synchronously by a waiting thread, which drains
    // every store and exits 0. Blocked before the writer thread starts, so it inherits it.
    sigset_t term;
    sigemptyset(&term);
    sigaddset(&term, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &term, nullptr);
    auto store = HandOverRows(path);
    if (write(ready[1], "r", 1) != 1) _exit(96);
    int signal = 0;
    sigwait(&term, &signal);
    DrainAllReportingStores();
    _exit(0);
  }
  ASSERT_GT(pid, 0);
  close(ready[1]);
  char byte = 0;
  ASSERT_EQ(read(ready[0], &byte, 1), 1);
  close(ready[0]);
  ASSERT_EQ(kill(pid, SIGTERM), 0);
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  ASSERT_TRUE(WIFEXITED(status)) << status;
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(MessageRows(path), static_cast<std::size_t>(kRows));
}

TEST(StoreExitTest, NormalExitWithTheStoreStillOpenKeepsEverything) {
  testing::TempDir dir;
  const std::string path = dir.File("reports.db");
  int status = RunChild([&] {
    auto store = HandOverRows(path);
    std::exit(3);  // no unwinding: the store is never destroyed, the exit handler drains
  });
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 3);
  EXPECT_EQ(MessageRows(path), static_cast<std::size_t>(kRows));
}

}  // namespace
}  // namespace qn
