#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/dispatch.h"

namespace qn {

// Named, system-wide notifications without payload (notify_register / notify_post).
// Safe to call from any thread.
class Notify {
 public:
  virtual ~Notify() = default;

  // Registers `handler` for `name`; it runs on `queue` with the registration's token each
  // time the notification is posted. On success returns 0 and stores the token in *token;
  // on failure returns a non-zero status and registers nothing.
  virtual std::uint32_t Register(const std::string& name, std::shared_ptr<SerialQueue> queue,
                                 std::function<void(int token)> handler, int* token) = 0;

  // Posts `name` to every registration in the system. Returns 0 or a non-zero status.
  virtual std::uint32_t Post(const std::string& name) = 0;

  // Ends a registration; its handler is not called again once Cancel returns.
  virtual void Cancel(int token) = 0;
};

}  // namespace qn
