#pragma once

#include <memory>
#include <string>

#include "platform/device_info.h"
#include "platform/log.h"

namespace qn {

struct LinuxDeviceInfoOptions {
  // A JSON object of answers ("InternalBuild": bool, "DeviceClassNumber": int, any
  // others); the daemon's --device-info.
  std::string path = "/etc/quenta/device-info.json";
  // The daemon's --internal-build: "InternalBuild" answers true whatever the file says.
  bool internal_build = false;
  // Where an unusable file is reported; may be null.
  std::shared_ptr<Log> log;
};

// Device information from a JSON file, read once when made. A missing file is normal (no
// answers, nothing logged); a file that cannot be read or is not a JSON object is logged
// once at error level and treated as empty. Without the file and the override the device
// has no answers: not an internal build, device class 0. Safe from any thread.
std::shared_ptr<DeviceInfo> NewLinuxDeviceInfo(LinuxDeviceInfoOptions options);

}  // namespace qn
