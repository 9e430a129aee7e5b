#pragma once

#include <atomic>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/device_info.h"

namespace qn::testing {

// A DeviceInfo whose answers the test sets. Counts the questions asked. Thread-safe.
class FakeDeviceInfo final : public DeviceInfo {
 public:
  std::optional<Value> CopyAnswer(const std::string& question) const override;
  std::int32_t GetSInt32Answer(const std::string& question) const override;

  void SetAnswer(const std::string& question, Value answer);
  // How many times `question` was asked, by either query.
  int Asked(const std::string& question) const;

 private:
  mutable std::mutex mu_;
  std::map<std::string, Value> answers_;
  mutable std::map<std::string, int> asked_;
};

}  // namespace qn::testing
