#include "tests/fakes/FakeOrientation.h"

#include "platform/orientation_text.h"

namespace qn::testing {

void FakeOrientation::RegisterDeviceOrientation(const std::string& callback_id, Callback callback) {
  std::lock_guard lock(mu_);
  device_[callback_id] = std::move(callback);
  events_.push_back("register device " + callback_id);
}

void FakeOrientation::RegisterUIOrientation(const std::string& callback_id, Callback callback) {
  std::lock_guard lock(mu_);
  ui_[callback_id] = std::move(callback);
  events_.push_back("register ui " + callback_id);
}

void FakeOrientation::UnregisterDeviceOrientation(const std::string& callback_id) {
  std::lock_guard lock(mu_);
  device_.erase(callback_id);
  events_.push_back("unregister device " + callback_id);
}

void FakeOrientation::UnregisterUIOrientation(const std::string& callback_id) {
  std::lock_guard lock(mu_);
  ui_.erase(callback_id);
  events_.push_back("unregister ui " + callback_id);
}

std::string FakeOrientation::OrientationToString(std::int32_t orientation) const {
  return OrientationText(orientation);
}

int FakeOrientation::FireDevice(std::int32_t orientation) {
  std::vector<Callback> callbacks;
  {
    std::lock_guard lock(mu_);
    for (const auto& [id, cb] : device_) callbacks.push_back(cb);
  }
  for (auto& cb : callbacks) cb(orientation);
  return static_cast<int>(callbacks.size());
}

int FakeOrientation::FireUI(std::int32_t orientation) {
  std::vector<Callback> callbacks;
  {
    std::lock_guard lock(mu_);
    for (const auto& [id, cb] : ui_) callbacks.push_back(cb);
  }
  for (auto& cb : callbacks) cb(orientation);
  return static_cast<int>(callbacks.size());
}

std::vector<std::string> FakeOrientation::Events() const {
  std::lock_guard lock(mu_);
  return events_;
}

int FakeOrientation::DeviceRegistrations() const {
  std::lock_guard lock(mu_);
  return static_cast<int>(device_.size());
}

int FakeOrientation::UIRegistrations() const {
  std::lock_guard lock(mu_);
  return static_cast<int>(ui_.size());
}

}  // namespace qn::testing
