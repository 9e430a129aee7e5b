#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "tests/fakes/TempDir.h"

namespace qn::testing {

// How long a test waits for something that should happen at once. Generous on purpose:
// it only bounds a failing test, it never measures anything.
inline constexpr std::chrono::seconds kPatience{30};

// A counter that threads bump and a test waits on.
class Counter {
 public:
  void Add(int n = 1) {
    std::lock_guard lock(mu_);
    value_ += n;
    cv_.notify_all();
  }
  int value() const {
    std::lock_guard lock(mu_);
    return value_;
  }
  // Waits until the counter reaches `target`; false when patience runs out.
  bool WaitFor(int target, std::chrono::steady_clock::duration patience = kPatience) const {
    std::unique_lock lock(mu_);
    return cv_.wait_for(lock, patience, [&] { return value_ >= target; });
  }

 private:
  mutable std::mutex mu_;
  mutable std::condition_variable cv_;
  int value_ = 0;
};

}  // namespace qn::testing
