#pragma once

#include <sys/types.h>

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/process.h"

namespace qn::testing {

// What FakeProcess::Exit throws instead of ending the process. Test-only: catch it around
// the call that should exit (EXPECT_THROW(..., ProcessExited)). When Exit is reached from
// a task that FakeDispatcher runs, it propagates out of RunUntilIdle / AdvanceBy.
struct ProcessExited {
  int status;
};

// A Process with a settable pid and process table. Exit throws ProcessExited with the
// status. Thread-safe.
class FakeProcess final : public Process {
 public:
  explicit FakeProcess(pid_t pid = 4242, std::string own_name = "qnreportingd");

  pid_t Pid() const override;
  std::string OwnName() const override;
  // Own pid: the own name; pid <= 0: nullopt; else the table's entry, if any.
  std::optional<std::string> NameOf(pid_t pid) const override;
  [[noreturn]] void Exit(int status) override;

  void SetPid(pid_t pid);
  void SetName(pid_t pid, std::string name);

 private:
  mutable std::mutex mu_;
  pid_t pid_;
  std::string own_name_;
  std::map<pid_t, std::string> names_;
};

}  // namespace qn::testing
