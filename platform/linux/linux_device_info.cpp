#include "platform/linux/linux_device_info.h"

#include <cerrno>
#include <cmath>
#include <limits>

#include "common/Json.h"
#include "platform/linux/small_file.h"

namespace qn {
namespace {

constexpr std::size_t kMaxFileBytes = 1 << 20;

// Reads the answers; an unusable file yields none and a description of why.
Dictionary ReadAnswers(const std::string& path, std::string* problem) {
  std::string text;
  if (auto error = ReadSmallFile(path, kMaxFileBytes, text)) {
    if (error->code != ENOENT) *problem = error->Description();
    return {};
  }
  Value parsed;
  if (auto error = ParseJson(text, parsed)) {
    *problem = error->Description();
    return {};
  }
  const Dictionary* answers = parsed.as_dictionary();
  if (answers == nullptr) {
    *problem = "not a JSON object";
    return {};
  }
  return *answers;
}

class LinuxDeviceInfo final : public DeviceInfo {
 public:
  explicit LinuxDeviceInfo(const LinuxDeviceInfoOptions& options) {
    std::string problem;
    answers_ = ReadAnswers(options.path, &problem);
    if (!problem.empty() && options.log) {
      QN_LOG(*options.log, nullptr, LogLevel::kError,
             "%s:%d:%s: ignoring device information file %s: %s", options.path, problem);
    }
    if (options.internal_build) answers_.Set("InternalBuild", true);
  }

  std::optional<Value> CopyAnswer(const std::string& question) const override {
    if (const Value* answer = answers_.Find(question)) return *answer;
    return std::nullopt;
  }

  std::int32_t GetSInt32Answer(const std::string& question) const override {
    const Value* answer = answers_.Find(question);
    if (answer == nullptr || !answer->is_number()) return 0;
    if (auto i = answer->as_int64()) {
      if (*i < std::numeric_limits<std::int32_t>::min() ||
          *i > std::numeric_limits<std::int32_t>::max()) {
        return 0;
      }
      return static_cast<std::int32_t>(*i);
    }
    const double d = answer->as_double().value_or(0);
    if (!std::isfinite(d) || d <= std::numeric_limits<std::int32_t>::min() - 1.0 ||
        d >= std::numeric_limits<std::int32_t>::max() + 1.0) {
      return 0;
    }
    return static_cast<std::int32_t>(d);
  }

 private:
  Dictionary answers_;  // immutable after construction
};

}  // namespace

std::shared_ptr<DeviceInfo> NewLinuxDeviceInfo(LinuxDeviceInfoOptions options) {
  return std::make_shared<LinuxDeviceInfo>(options);
}

}  // namespace qn
