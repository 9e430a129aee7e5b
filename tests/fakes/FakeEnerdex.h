#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "platform/enerdex.h"

namespace qn::testing {

// An Enerdex that records every power-log event it is given. Thread-safe.
class FakeEnerdex final : public Enerdex {
 public:
  struct Event {
    std::int32_t subsystem = 0;
    std::string name;
    Value payload;
    Value options;
  };

  void LogRegisteredEvent(std::int32_t subsystem, const std::string& event_name, Value payload,
                          Value options) override;

  // The events recorded so far, in the order they were logged.
  std::vector<Event> Events() const;
  void Clear();

 private:
  mutable std::mutex mu_;
  std::vector<Event> events_;  // GUARDED_BY(mu_)
};

}  // namespace qn::testing
