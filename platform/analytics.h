#pragma once

#include <functional>
#include <string>

#include "common/Value.h"

namespace qn {

// The analytics framework (AnalyticsSendEventLazy). Safe to call from any thread.
class Analytics {
 public:
  using PayloadProvider = std::function<Value()>;
  virtual ~Analytics() = default;
  // Sends the event `name`; `provider` is called (at most once, on any thread) when the
  // framework wants the payload. The provider owns what it returns.
  virtual void SendEventLazy(const std::string& name, PayloadProvider provider) = 0;
};

}  // namespace qn
