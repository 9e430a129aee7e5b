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

void FakeProcess::Exit(int status) {
  std::function<void(int)> hook;
  {
    std::lock_guard lock(mu_);
    exit_status_ = status;
    ++exit_calls_;
    hook = exit_hook_;
  }
  if (hook) hook(status);
  throw ProcessExited{status};
}

void FakeProcess::SetPid(pid_t pid) {
  std::lock_guard lock(mu_);
  pid_ = pid;
}

void FakeProcess::SetOwnName(std::string name) {
  std::lock_guard lock(mu_);
  own_name_ = std::move(name);
}

void FakeProcess::SetName(pid_t pid, std::string name) {
  std::lock_guard lock(mu_);
  names_[pid] = std::move(name);
}

void FakeProcess::RemoveName(pid_t pid) {
  std::lock_guard lock(mu_);
  names_.erase(pid);
}

void FakeProcess::SetExitHook(std::function<void(int status)> hook) {
  std::lock_guard lock(mu_);
  exit_hook_ = std::move(hook);
}

std::optional<int> FakeProcess::exit_status() const {
  std::lock_guard lock(mu_);
  return exit_status_;
}

int FakeProcess::exit_calls() const {
  std::lock_guard lock(mu_);
  return exit_calls_;
}

}  // namespace qn::testing
