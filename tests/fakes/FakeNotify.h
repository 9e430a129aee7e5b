#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/notify.h"

namespace qn::testing {

// Notifications within the test: Post queues each registered handler of the name on its
// queue with its token (so they run when the test's dispatcher runs them). Cancel stops
// later deliveries, including ones already queued. Thread-safe.
class FakeNotify final : public Notify {
 public:
  // Status 1 for an empty name, 2 for a missing queue or handler, else the status set by
  // FailRegistrations (0 by default).
  std::uint32_t Register(const std::string& name, std::shared_ptr<SerialQueue> queue,
                         std::function<void(int token)> handler, int* token) override;
  std::uint32_t Post(const std::string& name) override;
  void Cancel(int token) override;

  // Makes later registrations fail with `status` (0 = succeed again).
  void FailRegistrations(std::uint32_t status);

 private:
  struct Registration {
    std::string name;
    std::shared_ptr<SerialQueue> queue;
    std::function<void(int)> handler;
    int token;
    std::atomic<bool> active{true};
  };

  mutable std::mutex mu_;
  std::map<int, std::shared_ptr<Registration>> registrations_;
  int next_token_ = 1;
  std::uint32_t fail_status_ = 0;
};

}  // namespace qn::testing
