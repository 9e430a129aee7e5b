#pragma once

#include <memory>

#include "platform/trace.h"

namespace qn {

// Trace points as USDT probes: provider "quenta", probe "trace_point", arguments (code,
// arg1, arg2, arg3, arg4). A probe nobody listens to is a no-op instruction; bpftrace or
// perf attach to it by name, e.g.
//   bpftrace -e 'usdt:/usr/bin/qnreportingd:quenta:trace_point { printf("%x\n", arg0); }'
// Safe to call from any thread.
std::shared_ptr<Trace> NewLinuxTrace();

}  // namespace qn
