// The device-information file (--device-info): any bytes give answers or none, never harm.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/linux/linux_device_info.h"
#include "tests/fuzz/FuzzInput.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string path = qn::fuzz::Folder() + "/device-info.json";
  qn::fuzz::WriteInput(path, {reinterpret_cast<const char*>(data), size});
  auto info = qn::NewLinuxDeviceInfo({.path = path});
  (void)info->CopyAnswer("InternalBuild");
  (void)info->GetSInt32Answer("DeviceClassNumber");
  return 0;
}
