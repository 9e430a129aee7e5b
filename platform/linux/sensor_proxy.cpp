#include "platform/linux/sensor_proxy.h"

#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <cerrno>
#include <cstdint>
#include <cstring>

namespace qn {
namespace {

constexpr const char* kService = "net.hadess.SensorProxy";
constexpr const char* kPath = "/net/hadess/SensorProxy";
constexpr const char* kInterface = "net.hadess.SensorProxy";
constexpr const char* kOrientationProperty = "AccelerometerOrientation";
// A method call that takes longer only delays orientation, never a session.
constexpr std::uint64_t kCallTimeoutUsec = 5'000'000;

constexpr const char* kOwnerRule =
    "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
    "interface='org.freedesktop.DBus',member='NameOwnerChanged',arg0='net.hadess.SensorProxy'";
constexpr const char* kPropertiesRule =
    "type='signal',path='/net/hadess/SensorProxy',interface='org.freedesktop.DBus.Properties',"
    "member='PropertiesChanged',arg0='net.hadess.SensorProxy'";

// An sd_bus_error that frees itself, with the text to log.
struct BusError {
  sd_bus_error error{};  // SD_BUS_ERROR_NULL, which C++ compilers may refuse (a compound literal)
  ~BusError() { sd_bus_error_free(&error); }
  std::string Text(int r) const {
    return error.message ? error.message : std::string(std::strerror(-r));
  }
};

}  // namespace

// Lives on the thread: the sd-event loop, the bus connection and what is claimed.
class SensorProxy::Loop {
 public:
  explicit Loop(SensorProxy& owner) : owner_(owner) {}
  ~Loop() {
    Disconnect();
    if (event_) sd_event_unref(event_);
  }

  // Runs until the owner is stopping, then releases a claim.
  void Run() {
    if (sd_event_new(&event_) < 0 ||
        sd_event_add_io(event_, nullptr, owner_.wake_fd_, EPOLLIN, &Loop::OnWake, this) < 0) {
      Log(LogLevel::kError, "cannot start the orientation loop");
      return;
    }
    sd_event_loop(event_);
  }

 private:
  static int OnWake(sd_event_source*, int fd, std::uint32_t, void* userdata) {
    auto& self = *static_cast<Loop*>(userdata);
    std::uint64_t count = 0;
    while (::read(fd, &count, sizeof count) < 0 && errno == EINTR) {
    }
    bool wanted = false, stopping = false, asked = false;
    {
      std::lock_guard lock(self.owner_.mu_);
      wanted = self.owner_.wanted_;
      stopping = self.owner_.stopping_;
      asked = self.owner_.asked_ != self.asked_;
      self.asked_ = self.owner_.asked_;
    }
    self.Reconcile(wanted && !stopping, asked && !stopping);
    if (stopping) sd_event_exit(self.event_, 0);
    return 0;
  }

  static int OnOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
    auto& self = *static_cast<Loop*>(userdata);
    const char *name = nullptr, *before = nullptr, *after = nullptr;
    if (sd_bus_message_read(m, "sss", &name, &before, &after) < 0) return 0;
    if (std::strcmp(name, kService) != 0) return 0;
    const bool was_claimed = self.claimed_;
    self.Lost();
    self.owner_unique_ = after;
    if (*after == '\0') {
      if (was_claimed) self.Explain("iio-sensor-proxy left the system bus");
    } else if (self.wanted_ && self.Available()) {
      self.Claim();  // a new instance knows nothing of an earlier claim
    }
    return 0;
  }

  static int OnPropertiesChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
    auto& self = *static_cast<Loop*>(userdata);
    const char* sender = sd_bus_message_get_sender(m);
    if (!self.claimed_ || !sender || self.owner_unique_ != sender) return 0;
    if (auto orientation = OrientationIn(m)) self.owner_.on_change_(*orientation);
    return 0;
  }

  // The AccelerometerOrientation text in a PropertiesChanged signal, if it holds one.
  static std::optional<std::string> OrientationIn(sd_bus_message* m) {
    const char* interface = nullptr;
    if (sd_bus_message_read(m, "s", &interface) < 0 || std::strcmp(interface, kInterface) != 0 ||
        sd_bus_message_enter_container(m, 'a', "{sv}") < 0) {
      return std::nullopt;
    }
    std::optional<std::string> found;
    while (sd_bus_message_enter_container(m, 'e', "sv") > 0) {
      const char* key = nullptr;
      if (sd_bus_message_read(m, "s", &key) < 0) return std::nullopt;
      const char* text = nullptr;
      if (std::strcmp(key, kOrientationProperty) == 0) {
        if (sd_bus_message_read(m, "v", "s", &text) < 0) return std::nullopt;
        found = text;
      } else if (sd_bus_message_skip(m, "v") < 0) {
        return std::nullopt;
      }
      if (sd_bus_message_exit_container(m) < 0) return std::nullopt;
    }
    return found;
  }

  // Claims or releases as `wanted` says; `asked`: it was wanted since the last look.
  void Reconcile(bool wanted, bool asked) {
    wanted_ = wanted;
    if (claimed_ && sd_bus_is_open(bus_) <= 0) Lost();  // the bus went away under the claim
    if (wanted) {
      if (!claimed_ && Connect() && Available()) Claim();
    } else if (claimed_) {
      Release();
    } else if (asked && Connect()) {
      Available();  // a wish already over: only say why it could not have been met
    }
  }

  // Opens the system bus and watches the service, unless that is done and still open.
  bool Connect() {
    if (bus_ && sd_bus_is_open(bus_) > 0) return true;
    Disconnect();
    int r = sd_bus_open_system(&bus_);
    if (r >= 0) r = sd_bus_set_method_call_timeout(bus_, kCallTimeoutUsec);
    if (r >= 0) r = sd_bus_attach_event(bus_, event_, SD_EVENT_PRIORITY_NORMAL);
    if (r >= 0) r = sd_bus_add_match(bus_, &owner_match_, kOwnerRule, &Loop::OnOwnerChanged, this);
    if (r >= 0) {
      r = sd_bus_add_match(bus_, &properties_match_, kPropertiesRule, &Loop::OnPropertiesChanged,
                           this);
    }
    if (r < 0) {
      Disconnect();
      Explain(std::string("the system bus is not available: ") + std::strerror(-r));
      return false;
    }
    return true;
  }

  void Disconnect() {
    Lost();
    properties_match_ = sd_bus_slot_unref(properties_match_);
    owner_match_ = sd_bus_slot_unref(owner_match_);
    if (bus_) {
      sd_bus_detach_event(bus_);
      bus_ = sd_bus_flush_close_unref(bus_);
    }
  }

  // Whether the service is there and has an accelerometer; says why not.
  bool Available() {
    BusError error;
    int has_accelerometer = 0;
    const int r = sd_bus_get_property_trivial(bus_, kService, kPath, kInterface, "HasAccelerometer",
                                              &error.error, 'b', &has_accelerometer);
    if (r < 0) {
      Explain(sd_bus_error_has_names(&error.error, SD_BUS_ERROR_SERVICE_UNKNOWN,
                                     SD_BUS_ERROR_NAME_HAS_NO_OWNER)
                  ? std::string("iio-sensor-proxy is not on the system bus")
                  : "cannot ask iio-sensor-proxy for its accelerometer: " + error.Text(r));
      return false;
    }
    if (!has_accelerometer) Explain("the device has no accelerometer");
    return has_accelerometer != 0;
  }

  void Claim() {
    BusError error;
    // Its changes are taken only from the instance that was claimed.
    sd_bus_creds* creds = nullptr;
    const char* unique = nullptr;
    int r = sd_bus_get_name_creds(bus_, kService, SD_BUS_CREDS_UNIQUE_NAME, &creds);
    if (r >= 0) r = sd_bus_creds_get_unique_name(creds, &unique);
    if (r >= 0) owner_unique_ = unique;
    sd_bus_creds_unref(creds);
    if (r >= 0) {
      r = sd_bus_call_method(bus_, kService, kPath, kInterface, "ClaimAccelerometer", &error.error,
                             nullptr, nullptr);
    }
    if (r < 0) {
      Explain("cannot claim the accelerometer: " + error.Text(r));
      return;
    }
    claimed_ = true;
    explained_.clear();
  }

  void Release() {
    Lost();
    BusError error;
    const int r = sd_bus_call_method(bus_, kService, kPath, kInterface, "ReleaseAccelerometer",
                                     &error.error, nullptr, nullptr);
    if (r < 0) Log(LogLevel::kError, "cannot release the accelerometer: " + error.Text(r));
  }

  // The claim no longer holds: the orientation is no longer followed.
  void Lost() {
    if (!claimed_) return;
    claimed_ = false;
    owner_.on_change_(std::nullopt);
  }

  // Says once why the device orientation is not followed.
  void Explain(const std::string& why) {
    if (why == explained_) return;
    explained_ = why;
    Log(LogLevel::kInfo, "device orientation is not reported: " + why);
  }

  void Log(LogLevel level, const std::string& what) {
    if (owner_.log_) QN_LOG(*owner_.log_, nullptr, level, "%s:%d:%s: %s", what);
  }

  SensorProxy& owner_;
  sd_event* event_ = nullptr;
  sd_bus* bus_ = nullptr;
  sd_bus_slot* owner_match_ = nullptr;
  sd_bus_slot* properties_match_ = nullptr;
  bool wanted_ = false;
  std::uint64_t asked_ = 0;  // the owner's asked_ when the thread last looked
  bool claimed_ = false;
  std::string owner_unique_;  // the service's connection name when it is on the bus
  std::string explained_;     // the last reason logged, until a claim succeeds
};

SensorProxy::SensorProxy(std::shared_ptr<Log> log, Listener on_change)
    : log_(std::move(log)),
      on_change_(std::move(on_change)),
      wake_fd_(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)) {}

SensorProxy::~SensorProxy() {
  {
    std::lock_guard lock(mu_);
    stopping_ = true;
  }
  if (thread_.joinable()) {
    Wake();
    thread_.join();
  }
  if (wake_fd_ >= 0) ::close(wake_fd_);
}

void SensorProxy::SetWanted(bool wanted) {
  {
    std::lock_guard lock(mu_);
    wanted_ = wanted;
    if (wanted) ++asked_;
    if (wanted && !thread_.joinable() && !stopping_ && wake_fd_ >= 0) {
      thread_ = std::thread([this] {
        pthread_setname_np(pthread_self(), "qn-orientation");
        Loop(*this).Run();
      });
    }
  }
  Wake();
}

void SensorProxy::Wake() {
  const std::uint64_t one = 1;
  while (wake_fd_ >= 0 && ::write(wake_fd_, &one, sizeof one) < 0 && errno == EINTR) {
  }
}

}  // namespace qn
