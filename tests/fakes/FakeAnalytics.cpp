#include "tests/fakes/FakeAnalytics.h"

#include <utility>

namespace qn::testing {

void FakeAnalytics::SendEventLazy(const std::string& name, PayloadProvider provider) {
  // The provider runs outside the lock: it may itself send events.
  Value payload = provider ? provider() : Value();
  std::lock_guard lock(mu_);
  events_.push_back(Event{name, std::move(payload)});
}

std::vector<FakeAnalytics::Event> FakeAnalytics::Events() const {
  std::lock_guard lock(mu_);
  return events_;
}

std::vector<FakeAnalytics::Event> FakeAnalytics::EventsNamed(const std::string& name) const {
  std::lock_guard lock(mu_);
  std::vector<Event> named;
  for (const Event& e : events_) {
    if (e.name == name) named.push_back(e);
  }
  return named;
}

void FakeAnalytics::Clear() {
  std::lock_guard lock(mu_);
  events_.clear();
}

}  // namespace qn::testing
