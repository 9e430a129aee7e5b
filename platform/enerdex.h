#pragma once

#include <cstdint>
#include <string>

#include "common/Value.h"

namespace qn {

// The power-log framework (EDLogRegisteredEvent). Safe to call from any thread; the call
// only hands the event over (it does not wait for a disk).
class Enerdex {
 public:
  virtual ~Enerdex() = default;
  virtual void LogRegisteredEvent(std::int32_t subsystem, const std::string& event_name,
                                  Value payload, Value options) = 0;
};

}  // namespace qn
