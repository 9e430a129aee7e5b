#include "platform/linux/linux_trace.h"

#include <sys/sdt.h>

namespace qn {
namespace {

class LinuxTrace final : public Trace {
 public:
  void TracePoint(std::uint32_t code, std::uint64_t arg1, std::uint64_t arg2, std::uint64_t arg3,
                  std::uint64_t arg4) override {
    DTRACE_PROBE5(quenta, trace_point, code, arg1, arg2, arg3, arg4);
  }
};

}  // namespace

std::shared_ptr<Trace> NewLinuxTrace() { return std::make_shared<LinuxTrace>(); }

}  // namespace qn
