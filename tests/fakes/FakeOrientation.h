#pragma once

#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/orientation.h"

namespace qn::testing {

// An Orientation whose notifications the test fires. Records every registration and
// unregistration in order ("register device <id>", "register ui <id>", "unregister device
// <id>", "unregister ui <id>"). Thread-safe; callbacks run on the firing thread without the
// fake's lock held, so a callback that a concurrent Fire has already picked up may still run
// after its unregistration returns (as with a source that delivers on its own threads).
class FakeOrientation final : public Orientation {
 public:
  void RegisterDeviceOrientation(const std::string& callback_id, Callback callback) override;
  void RegisterUIOrientation(const std::string& callback_id, Callback callback) override;
  void UnregisterDeviceOrientation(const std::string& callback_id) override;
  void UnregisterUIOrientation(const std::string& callback_id) override;
  // OrientationText (platform/orientation_text.h).
  std::string OrientationToString(std::int32_t orientation) const override;

  // Calls every registered device (or UI) callback with `orientation`; returns how many.
  int FireDevice(std::int32_t orientation);
  int FireUI(std::int32_t orientation);

  std::vector<std::string> Events() const;
  int DeviceRegistrations() const;  // currently registered
  int UIRegistrations() const;

 private:
  mutable std::mutex mu_;
  std::map<std::string, Callback> device_;
  std::map<std::string, Callback> ui_;
  std::vector<std::string> events_;
};

}  // namespace qn::testing
