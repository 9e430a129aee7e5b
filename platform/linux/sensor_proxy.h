#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "platform/log.h"

namespace qn {

// Follows the device's orientation as iio-sensor-proxy (net.hadess.SensorProxy on the system
// bus, reached through sd-bus, so DBUS_SYSTEM_BUS_ADDRESS is honoured) reports it.
//
// While wanted, the accelerometer is claimed (ClaimAccelerometer) and every change of its
// AccelerometerOrientation property is passed to `on_change` with the property's text; when
// no longer wanted, it is released (ReleaseAccelerometer). When the bus, the service or an
// accelerometer is missing nothing is claimed and one info line says why (a reason is not
// repeated until a claim succeeded); each time it becomes wanted this is looked at, even
// when it is no longer wanted by the time the thread gets to it. A service that appears on the bus
// later (NameOwnerChanged) is claimed then; one that leaves makes `on_change` see nullopt, as does
// a release. The bus is tried again at the next SetWanted(true) after it failed.
//
// All bus work and every `on_change` call happen on one thread of its own, started by the
// first SetWanted(true). SetWanted is safe from any thread and returns at once. The
// destructor releases a claim and joins the thread.
class SensorProxy {
 public:
  using Listener = std::function<void(const std::optional<std::string>& orientation)>;
  SensorProxy(std::shared_ptr<Log> log, Listener on_change);
  ~SensorProxy();
  SensorProxy(const SensorProxy&) = delete;
  SensorProxy& operator=(const SensorProxy&) = delete;

  void SetWanted(bool wanted);

 private:
  class Loop;  // the thread's sd-event loop and bus connection

  void Wake();

  const std::shared_ptr<Log> log_;
  const Listener on_change_;
  const int wake_fd_;  // an eventfd: the thread looks at wanted_ and stopping_ when it reads

  std::mutex mu_;
  bool wanted_ = false;  // guarded by mu_
  // How often it became wanted, so that the thread looks at the bus even after a wish that
  // was over before it woke.
  std::uint64_t asked_ = 0;  // guarded by mu_
  bool stopping_ = false;    // guarded by mu_
  std::thread thread_;       // started under mu_
};

}  // namespace qn
