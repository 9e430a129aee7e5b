#pragma once

#include <cstddef>
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
  // framework wants the payload. The provider owns what it returns. `held_bytes` is about
  // what the provider keeps alive until then (Value::ApproximateBytes; 0 when it shares
  // what something else already counts), for the framework's accounting of what waits.
  virtual void SendEventLazy(const std::string& name, PayloadProvider provider,
                             std::size_t held_bytes) = 0;
};

}  // namespace qn
