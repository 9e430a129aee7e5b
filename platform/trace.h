#pragma once

#include <cstdint>

namespace qn {

// Event trace points (trace_point): a 32-bit code and four 64-bit arguments.
// Safe to call from any thread; costs next to nothing when nobody listens.
class Trace {
 public:
  virtual ~Trace() = default;
  virtual void TracePoint(std::uint32_t code, std::uint64_t arg1 = 0, std::uint64_t arg2 = 0,
                          std::uint64_t arg3 = 0, std::uint64_t arg4 = 0) = 0;
};

}  // namespace qn
