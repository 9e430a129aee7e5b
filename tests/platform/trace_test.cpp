#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <string>

#include "platform/linux/linux_trace.h"

namespace qn {
namespace {

TEST(LinuxTraceTest, ProbeIsInTheBinaryAndCallable) {
  auto trace = NewLinuxTrace();
  trace->TracePoint(0x21042814);
  trace->TracePoint(0x21042838, 1, 2, 3, 4);

  // The probe's ELF note (.note.stapsdt) names provider and probe as consecutive
  // NUL-terminated strings; it is absent when the probe was compiled out.
  std::ifstream exe("/proc/self/exe", std::ios::binary);
  ASSERT_TRUE(exe.good());
  const std::string image((std::istreambuf_iterator<char>(exe)), std::istreambuf_iterator<char>());
  const std::string note("quenta\0trace_point\0", 19);
  EXPECT_NE(image.find(note), std::string::npos);
}

}  // namespace
}  // namespace qn
