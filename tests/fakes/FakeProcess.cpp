#include "tests/fakes/FakeProcess.h"

namespace qn::testing {

FakeProcess::FakeProcess(pid_t pid, std::string own_name)
    : pid_(pid), own_name_(std::move(own_name)) {}

pid_t FakeProcess::Pid() const {
  std::lock_guard lock(mu_);
  return pid_;
}

std::string FakeProcess::OwnName() const {
  std::lock_guard lock(mu_);
  return own_name_;
}

std::optional<std::string> FakeProcess::NameOf(pid_t pid) const {
  std::lock_guard lock(mu_);
  if (pid <= 0) return std::nullopt;
  if (pid == pid_) return own_name_;
  auto it = names_.find(pid);
  if (it == names_.end()) return std::nullopt;
  return it->second;
}

void FakeProcess::Exit(int status) { throw ProcessExited{status}; }

void FakeProcess::SetPid(pid_t pid) {
  std::lock_guard lock(mu_);
  pid_ = pid;
}

void FakeProcess::SetName(pid_t pid, std::string name) {
  std::lock_guard lock(mu_);
  names_[pid] = std::move(name);
}

}  // namespace qn::testing
