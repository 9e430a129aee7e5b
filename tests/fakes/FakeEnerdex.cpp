#include "tests/fakes/FakeEnerdex.h"

#include <utility>

namespace qn::testing {

void FakeEnerdex::LogRegisteredEvent(std::int32_t subsystem, const std::string& event_name,
                                     Value payload, Value options) {
  std::lock_guard lock(mu_);
  events_.push_back(Event{subsystem, event_name, std::move(payload), std::move(options)});
}

std::vector<FakeEnerdex::Event> FakeEnerdex::Events() const {
  std::lock_guard lock(mu_);
  return events_;
}

void FakeEnerdex::Clear() {
  std::lock_guard lock(mu_);
  events_.clear();
}

}  // namespace qn::testing
