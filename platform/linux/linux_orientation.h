#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"
#include "platform/dispatch.h"
#include "platform/log.h"
#include "platform/notify.h"
#include "platform/orientation.h"

namespace qn {

// The notifications that carry an orientation: the file <runtime dir>/notify/NAME holds the
// text of the value last posted (see linux_notify.h).
inline constexpr const char* kUIOrientationNotification = "com.norvel.quenta.orientation.ui";
inline constexpr const char* kDeviceOrientationNotification =
    "com.norvel.quenta.orientation.device";

struct LinuxOrientationOptions {
  std::string runtime_dir;
  std::shared_ptr<Log> log;
  // Tells of a new UI orientation (kUIOrientationNotification); null: no UI orientation.
  std::shared_ptr<Notify> notify;
  // Where a new UI orientation is read and its callbacks run.
  std::shared_ptr<SerialQueue> queue;
};

// Orientation on Linux. Device orientation comes from iio-sensor-proxy (see SensorProxy):
// the accelerometer is claimed while at least one device callback is registered; each change
// calls every device callback on SensorProxy's thread and is posted as
// kDeviceOrientationNotification. UI orientation is what `qnreport orientation ui` posts as
// kUIOrientationNotification: each post calls every UI callback on `queue` (posts close
// together may arrive as one); a text that is not an orientation name is logged and ignored.
// Orientation values and texts are LinuxOrientationText's. Unregistering waits for a
// callback of that kind running on another thread. Safe from any thread.
std::shared_ptr<Orientation> NewLinuxOrientation(LinuxOrientationOptions options);

// The orientation names, as iio-sensor-proxy gives them: 1 "normal", 2 "bottom-up",
// 3 "left-up", 4 "right-up", any other value "undefined" (0).
std::string LinuxOrientationText(std::int32_t orientation);
// The value of an orientation name; nullopt for a text that is none.
std::optional<std::int32_t> LinuxOrientationValue(std::string_view text);

// Posts `text` (an orientation name) as the UI orientation. Fails for a text that is not an
// orientation name or a file that cannot be written.
std::optional<Error> PostUIOrientation(const std::string& runtime_dir, const std::string& text);

// What was posted last under `runtime_dir`: the device orientation the daemon follows
// (nullopt while it follows none) and the UI orientation (nullopt when none was posted).
struct PostedOrientation {
  std::optional<std::string> device;
  std::optional<std::string> ui;
};
PostedOrientation ReadPostedOrientation(const std::string& runtime_dir);

}  // namespace qn
