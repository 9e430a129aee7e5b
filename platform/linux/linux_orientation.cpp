#include "platform/linux/linux_orientation.h"

#include <unistd.h>

#include <array>
#include <cerrno>
#include <map>
#include <mutex>
#include <vector>

#include "common/Files.h"
#include "platform/linux/linux_notify.h"
#include "platform/linux/sensor_proxy.h"
#include "platform/linux/small_file.h"

namespace qn {
namespace {

constexpr std::array<std::string_view, 5> kNames = {"undefined", "normal", "bottom-up", "left-up",
                                                    "right-up"};
constexpr std::size_t kMaxPostedBytes = 64;
constexpr mode_t kNotifyDirMode = 0755;

// The text of an orientation file, without the line end; nullopt when there is none.
std::optional<std::string> ReadPosted(const std::string& runtime_dir, const char* name,
                                      std::optional<Error>* error = nullptr) {
  std::string text;
  auto failure = ReadSmallFile(NotificationFile(runtime_dir, name), kMaxPostedBytes, text);
  if (failure) {
    if (error) *error = std::move(failure);
    return std::nullopt;
  }
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
  return text;
}

// The callbacks of one kind by ID. `on_any` is told, under the table's lock, each time the
// table goes from empty to holding a callback (true) and back (false).
class CallbackTable {
 public:
  explicit CallbackTable(std::function<void(bool any)> on_any = nullptr)
      : on_any_(std::move(on_any)) {}

  void Add(const std::string& id, Orientation::Callback callback) {
    std::lock_guard lock(mu_);
    const bool was_empty = callbacks_.empty();
    callbacks_[id] = std::move(callback);
    if (was_empty && on_any_) on_any_(true);
  }

  // Once this returns the callback is not called again.
  void Remove(const std::string& id) {
    Orientation::Callback gone;  // destroyed outside the locks
    {
      std::lock_guard lock(mu_);
      auto it = callbacks_.find(id);
      if (it == callbacks_.end()) return;
      gone = std::move(it->second);
      callbacks_.erase(it);
      if (callbacks_.empty() && on_any_) on_any_(false);
    }
    // A delivery that took the callback before it was removed ends first; a callback that
    // removes itself (on the delivering thread) goes on at once.
    std::lock_guard wait(delivering_);
  }

  void Deliver(std::int32_t value) {
    std::lock_guard delivering(delivering_);
    std::vector<Orientation::Callback> targets;
    {
      std::lock_guard lock(mu_);
      for (const auto& [id, callback] : callbacks_) targets.push_back(callback);
    }
    for (const auto& callback : targets) callback(value);
  }

 private:
  const std::function<void(bool)> on_any_;
  std::recursive_mutex delivering_;  // held while callbacks run; taken before mu_
  std::mutex mu_;
  std::map<std::string, Orientation::Callback> callbacks_;  // guarded by mu_
};

class LinuxOrientation final : public Orientation,
                               public std::enable_shared_from_this<LinuxOrientation> {
 public:
  explicit LinuxOrientation(LinuxOrientationOptions options)
      : options_(std::move(options)),
        device_([this](bool any) { proxy_.SetWanted(any); }),
        proxy_(options_.log, [this](const std::optional<std::string>& text) { OnDevice(text); }) {}

  ~LinuxOrientation() override {
    if (ui_token_ != 0) options_.notify->Cancel(ui_token_);
  }

  // Starts listening for posted UI orientations.
  void WatchUI() {
    if (!options_.notify || !options_.queue) return;
    std::weak_ptr<LinuxOrientation> weak = weak_from_this();
    const std::uint32_t status = options_.notify->Register(
        kUIOrientationNotification, options_.queue,
        [weak](int) {
          if (auto self = weak.lock()) self->OnUI();
        },
        &ui_token_);
    if (status != 0) Log("cannot watch the UI orientation (status " + std::to_string(status) + ")");
  }

  void RegisterDeviceOrientation(const std::string& callback_id, Callback callback) override {
    device_.Add(callback_id, std::move(callback));
  }
  void RegisterUIOrientation(const std::string& callback_id, Callback callback) override {
    ui_.Add(callback_id, std::move(callback));
  }
  void UnregisterDeviceOrientation(const std::string& callback_id) override {
    device_.Remove(callback_id);
  }
  void UnregisterUIOrientation(const std::string& callback_id) override { ui_.Remove(callback_id); }
  std::string OrientationToString(std::int32_t orientation) const override {
    return LinuxOrientationText(orientation);
  }

 private:
  // On the proxy's thread: a new device orientation, or nullopt when none is followed now.
  void OnDevice(const std::optional<std::string>& text) {
    const std::string file = NotificationFile(options_.runtime_dir, kDeviceOrientationNotification);
    if (!text) {
      ::unlink(file.c_str());
      return;
    }
    const std::int32_t value = LinuxOrientationValue(*text).value_or(0);
    device_.Deliver(value);
    // The file only informs `qnreport orientation`; without it nothing else is lost.
    WriteFileAtomically(file, LinuxOrientationText(value) + "\n");
  }

  // On the queue: a UI orientation was posted.
  void OnUI() {
    std::optional<Error> error;
    const auto text = ReadPosted(options_.runtime_dir, kUIOrientationNotification, &error);
    if (!text) {
      Log("cannot read the UI orientation: " + error->Description());
    } else if (auto value = LinuxOrientationValue(*text)) {
      ui_.Deliver(*value);
    } else {
      Log("ignored a UI orientation that is not normal, bottom-up, left-up, right-up or "
          "undefined");
    }
  }

  void Log(const std::string& what) {
    if (options_.log) QN_LOG(*options_.log, nullptr, LogLevel::kError, "%s:%d:%s: %s", what);
  }

  const LinuxOrientationOptions options_;
  CallbackTable device_;
  CallbackTable ui_;
  int ui_token_ = 0;  // set once by WatchUI
  // Last, so that its thread ends before the tables it delivers to go.
  SensorProxy proxy_;
};

}  // namespace

std::string LinuxOrientationText(std::int32_t orientation) {
  if (orientation < 0 || orientation >= static_cast<std::int32_t>(kNames.size())) {
    return std::string(kNames[0]);
  }
  return std::string(kNames[static_cast<std::size_t>(orientation)]);
}

std::optional<std::int32_t> LinuxOrientationValue(std::string_view text) {
  for (std::size_t i = 0; i < kNames.size(); ++i) {
    if (kNames[i] == text) return static_cast<std::int32_t>(i);
  }
  return std::nullopt;
}

std::optional<Error> PostUIOrientation(const std::string& runtime_dir, const std::string& text) {
  if (!LinuxOrientationValue(text)) {
    return Error{"posix", EINVAL,
                 "\"" + text + "\" is not normal, bottom-up, left-up, right-up or undefined"};
  }
  const std::string file = NotificationFile(runtime_dir, kUIOrientationNotification);
  if (auto error = CreateDirectories(file.substr(0, file.rfind('/')), kNotifyDirMode)) return error;
  return WriteFileAtomically(file, text + "\n");
}

PostedOrientation ReadPostedOrientation(const std::string& runtime_dir) {
  return {ReadPosted(runtime_dir, kDeviceOrientationNotification),
          ReadPosted(runtime_dir, kUIOrientationNotification)};
}

std::shared_ptr<Orientation> NewLinuxOrientation(LinuxOrientationOptions options) {
  auto orientation = std::make_shared<LinuxOrientation>(std::move(options));
  orientation->WatchUI();
  return orientation;
}

}  // namespace qn
