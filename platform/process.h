#pragma once

#include <optional>
#include <string>
#include <sys/types.h>

namespace qn {

// Process information and process exit. Safe to call from any thread.
class Process {
 public:
  virtual ~Process() = default;
  // getpid().
  virtual pid_t Pid() const = 0;
  // The process's own name.
  virtual std::string OwnName() const = 0;
  // Another process's short command name (at most 16 bytes, the kernel's comm), or nullopt
  // when the process does not exist or cannot be read.
  virtual std::optional<std::string> NameOf(pid_t pid) const = 0;
  // Ends the process with `status`. The Linux implementation first runs the shutdown work
  // it was constructed with (draining the reporting store), so that nothing handed to the
  // store is lost; nothing else is stopped or flushed.
  [[noreturn]] virtual void Exit(int status) = 0;
};

}  // namespace qn
