#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "platform/analytics.h"

namespace qn::testing {

// An Analytics that records each event as it is sent: the payload provider is called at
// once, on the caller's thread (a provider that is empty gives a null payload). Thread-safe.
class FakeAnalytics final : public Analytics {
 public:
  struct Event {
    std::string name;
    Value payload;
  };

  void SendEventLazy(const std::string& name, PayloadProvider provider) override;

  // The events recorded so far, in the order they were sent.
  std::vector<Event> Events() const;
  // The events named `name`, in order.
  std::vector<Event> EventsNamed(const std::string& name) const;
  void Clear();

 private:
  mutable std::mutex mu_;
  std::vector<Event> events_;  // GUARDED_BY(mu_)
};

}  // namespace qn::testing
