#include "platform/linux/linux_orientation.h"

#include <map>
#include <mutex>

#include "platform/orientation_text.h"

namespace qn {
namespace {

class LinuxOrientation final : public Orientation {
 public:
  void RegisterDeviceOrientation(const std::string& callback_id, Callback callback) override {
    std::lock_guard lock(mu_);
    device_[callback_id] = std::move(callback);
  }
  void RegisterUIOrientation(const std::string& callback_id, Callback callback) override {
    std::lock_guard lock(mu_);
    ui_[callback_id] = std::move(callback);
  }
  void UnregisterDeviceOrientation(const std::string& callback_id) override {
    Callback gone;  // destroyed outside the lock
    std::lock_guard lock(mu_);
    if (auto it = device_.find(callback_id); it != device_.end()) {
      gone = std::move(it->second);
      device_.erase(it);
    }
  }
  void UnregisterUIOrientation(const std::string& callback_id) override {
    Callback gone;
    std::lock_guard lock(mu_);
    if (auto it = ui_.find(callback_id); it != ui_.end()) {
      gone = std::move(it->second);
      ui_.erase(it);
    }
  }
  std::string OrientationToString(std::int32_t orientation) const override {
    return OrientationText(orientation);
  }

 private:
  std::mutex mu_;
  std::map<std::string, Callback> device_;  // guarded by mu_
  std::map<std::string, Callback> ui_;      // guarded by mu_
};

}  // namespace

std::shared_ptr<Orientation> NewLinuxOrientation() { return std::make_shared<LinuxOrientation>(); }

}  // namespace qn
