#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace qn {

// Orientation notifications of the audio framework (QNRegisterDeviceOrientation,
// QNRegisterUIOrientation, their unregistration, and the orientation-to-string function).
// Callbacks run on threads of the implementation's choosing. Safe from any thread.
class Orientation {
 public:
  using Callback = std::function<void(std::int32_t orientation)>;
  virtual ~Orientation() = default;

  // Registers `callback` under `callback_id`, replacing one registered under the same ID.
  virtual void RegisterDeviceOrientation(const std::string& callback_id, Callback callback) = 0;
  virtual void RegisterUIOrientation(const std::string& callback_id, Callback callback) = 0;
  // Removes the registration; the callback is not called once this returns.
  virtual void UnregisterDeviceOrientation(const std::string& callback_id) = 0;
  virtual void UnregisterUIOrientation(const std::string& callback_id) = 0;

  // The text for an orientation value ("Portrait", "LandscapeLeft", ...; "Unknown" otherwise).
  virtual std::string OrientationToString(std::int32_t orientation) const = 0;
};

}  // namespace qn
