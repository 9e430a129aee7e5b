#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "common/Value.h"

namespace qn {

// Device-information queries (QDCopyAnswer, QDGetSInt32Answer). Safe from any thread.
class DeviceInfo {
 public:
  virtual ~DeviceInfo() = default;
  // The answer to `question` ("InternalBuild", "DeviceClassNumber", ...), or nullopt when
  // the device has no answer.
  virtual std::optional<Value> CopyAnswer(const std::string& question) const = 0;
  // The answer as a signed 32-bit integer; 0 when there is none or it is not a number.
  virtual std::int32_t GetSInt32Answer(const std::string& question) const = 0;
};

}  // namespace qn
