#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <string>

#include "platform/linux/linux_process.h"

namespace qn {
namespace {

// A child process that renames itself and then waits until the test lets it go.
class NamedChild {
 public:
  explicit NamedChild(const char* name) {
    int ready[2];
    if (::pipe2(ready, O_CLOEXEC) != 0 || ::pipe2(hold_, O_CLOEXEC) != 0) std::abort();
    pid_ = ::fork();
    if (pid_ == 0) {
      // Only async-signal-safe calls from here on.
      ::prctl(PR_SET_NAME, name, 0, 0, 0);
      ::close(ready[0]);
      ::close(hold_[1]);
      char c = 1;
      if (::write(ready[1], &c, 1) != 1) ::_exit(1);
      while (::read(hold_[0], &c, 1) != 0) {
      }
      ::_exit(0);
    }
    ::close(ready[1]);
    ::close(hold_[0]);
    char c;
    if (::read(ready[0], &c, 1) != 1) std::abort();
    ::close(ready[0]);
  }
  // Lets the child exit and reaps it.
  void Release() {
    if (pid_ <= 0) return;
    ::close(hold_[1]);
    int status;
    ::waitpid(pid_, &status, 0);
    released_ = pid_;
    pid_ = -1;
  }
  ~NamedChild() { Release(); }
  pid_t pid() const { return pid_ > 0 ? pid_ : released_; }

 private:
  pid_t pid_ = -1;
  pid_t released_ = -1;
  int hold_[2];
};

TEST(LinuxProcessTest, OwnPidAndName) {
  auto process = NewLinuxProcess();
  EXPECT_EQ(process->Pid(), ::getpid());
  std::ifstream comm("/proc/self/comm");
  std::string expected;
  std::getline(comm, expected);
  EXPECT_EQ(process->OwnName(), expected);
  EXPECT_EQ(process->NameOf(::getpid()), expected);
}

TEST(LinuxProcessTest, NoNameForPidsBelowOne) {
  auto process = NewLinuxProcess();
  EXPECT_EQ(process->NameOf(0), std::nullopt);
  EXPECT_EQ(process->NameOf(-1), std::nullopt);
  EXPECT_EQ(process->NameOf(-2147483647 - 1), std::nullopt);
}

TEST(LinuxProcessTest, NameOfAChildAndOfAGoneProcess) {
  auto process = NewLinuxProcess();
  NamedChild child("qn-child-test");
  EXPECT_EQ(process->NameOf(child.pid()), "qn-child-test");
  child.Release();
  EXPECT_EQ(process->NameOf(child.pid()), std::nullopt);
}

TEST(LinuxProcessTest, LongNamesAreTheKernelsSixteenBytes) {
  NamedChild child("a-very-long-process-name");
  // The kernel keeps 15 characters plus the terminator.
  EXPECT_EQ(NewLinuxProcess()->NameOf(child.pid()), "a-very-long-pro");
}

TEST(LinuxProcessDeathTest, ExitRunsShutdownFlushesAndUsesTheStatus) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        // Fully buffered: the text only appears if Exit flushes stdio.
        static char buffer[4096];
        std::setvbuf(stderr, buffer, _IOFBF, sizeof buffer);
        std::fputs("before exit\n", stderr);
        auto process = NewLinuxProcess([] { std::fputs("store drained\n", stderr); });
        process->Exit(2);
      },
      ::testing::ExitedWithCode(2), "before exit\nstore drained");
}

TEST(LinuxProcessDeathTest, ExitFromTheShutdownWorkEndsAtOnce) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        std::shared_ptr<Process> process;
        process = NewLinuxProcess([&process] { process->Exit(3); });
        process->Exit(2);
      },
      ::testing::ExitedWithCode(3), "");
}

}  // namespace
}  // namespace qn
