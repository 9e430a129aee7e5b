#include "tests/fakes/FakeNotify.h"

#include <vector>

namespace qn::testing {

std::uint32_t FakeNotify::Register(const std::string& name, std::shared_ptr<SerialQueue> queue,
                                   std::function<void(int token)> handler, int* token) {
  if (name.empty()) return 1;
  if (!queue || !handler) return 2;
  std::lock_guard lock(mu_);
  if (fail_status_ != 0) return fail_status_;
  auto registration = std::make_shared<Registration>();
  registration->name = name;
  registration->queue = std::move(queue);
  registration->handler = std::move(handler);
  registration->token = next_token_++;
  registrations_[registration->token] = registration;
  if (token) *token = registration->token;
  return 0;
}

std::uint32_t FakeNotify::Post(const std::string& name) {
  if (name.empty()) return 1;
  std::vector<std::shared_ptr<Registration>> targets;
  {
    std::lock_guard lock(mu_);
    for (const auto& [unused, registration] : registrations_) {
      if (registration->name == name) targets.push_back(registration);
    }
  }
  for (auto& registration : targets) {
    registration->queue->Async([registration] {
      if (registration->active) registration->handler(registration->token);
    });
  }
  return 0;
}

void FakeNotify::Cancel(int token) {
  std::lock_guard lock(mu_);
  auto it = registrations_.find(token);
  if (it == registrations_.end()) return;
  it->second->active = false;
  registrations_.erase(it);
}

void FakeNotify::FailRegistrations(std::uint32_t status) {
  std::lock_guard lock(mu_);
  fail_status_ = status;
}

}  // namespace qn::testing
