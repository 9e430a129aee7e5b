#pragma once

#include <algorithm>
#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/trace.h"

namespace qn::testing {

// A Trace that records every trace point's code in order. Thread-safe.
class TraceRecorder final : public Trace {
 public:
  void TracePoint(std::uint32_t code, std::uint64_t a1, std::uint64_t a2, std::uint64_t a3,
                  std::uint64_t a4) override {
    std::lock_guard lock(mu_);
    codes_.push_back(code);
    all_zero_args_ = all_zero_args_ && a1 == 0 && a2 == 0 && a3 == 0 && a4 == 0;
  }
  std::vector<std::uint32_t> Codes() const {
    std::lock_guard lock(mu_);
    return codes_;
  }
  int Count(std::uint32_t code) const {
    std::lock_guard lock(mu_);
    return static_cast<int>(std::count(codes_.begin(), codes_.end(), code));
  }
  // Whether every trace point so far had four zero arguments.
  bool AllArgumentsZero() const {
    std::lock_guard lock(mu_);
    return all_zero_args_;
  }
  void Clear() {
    std::lock_guard lock(mu_);
    codes_.clear();
  }

 private:
  mutable std::mutex mu_;
  std::vector<std::uint32_t> codes_;
  bool all_zero_args_ = true;
};

}  // namespace qn::testing
