#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "common/Value.h"
#include "platform/platform.h"

namespace qn {

// The words for a message's numbers and a few process-wide answers that every part of the
// service shares. All functions are reentrant and safe to call from any thread.

// The name of a 32-bit category: the origin word of the upper 16 bits and "_" when the
// value carries origin bits (and is not all ones), then the name of the low 16 bits.
//   0x10000008 -> "DSP_Error", 0x30000001 -> "_Generic", 0xFFFFFFFF -> "Undefined".
std::string QNReportingCategoryName(std::uint32_t category);

// The name of a message type: "Generic", "Start", "Stop", "Setup", "Error",
// "IssueDetector" for 0-5, "Unknown" for 65535, "Undefined" otherwise.
std::string QNReportingTypeName(std::uint16_t type);

// The name of a service type: "generic" (0) ... "apiusage" (12), "unknown" for 65535 (not
// set), and "telephony" for every other value.
std::string QNReportingServiceTypeName(std::uint32_t serviceType);

// The host application of a session: the printed form of the user-info value under
// "HostApplicationDisplayID", or "Unknown" when `userInfo` is null or lacks the key.
std::string QNReportingHostApplicationName(const Dictionary* userInfo);
inline std::string QNReportingHostApplicationName(
    const std::shared_ptr<const Dictionary>& userInfo) {
  return QNReportingHostApplicationName(userInfo.get());
}

// Whether the device runs an internal build. The device-information answer
// "InternalBuild" is read once per Platform (thread-safe, on the first call) and kept;
// a missing answer or device-information service means false.
bool QNReportingIsInternalBuild(const Platform& platform);

// A bounded wait on `condition` for `*done` to become true, without holding a thread.
//
// With the lock held: when `*done` is already set, `completion(true)` runs at once on the
// calling thread and nothing is logged. Otherwise it logs `waitingMessage` (default level)
// and registers a wait of `timeout` seconds. Each wake-up by a signal logs "continuing"
// and re-checks `*done`: set -> `completion(true)`; not set -> waits again with a fresh
// deadline (so repeated wake-ups extend the total wait). When a deadline passes it logs
// `timeoutMessage` at error level and calls `completion(false)`.
//
// Lines go to `log` (null = the process default log) under the function name
// "QNReportingUtilityWait". `completion` runs without the condition's lock held, on the
// calling thread (flag already set) or on a dispatcher thread. The wait keeps `condition`
// and `done` alive until it completes.
// REQUIRES: whoever sets `*done` does so holding the condition's lock, and signals while
// still holding it. No other waiter on `condition`.
void QNReportingUtilityWait(const Platform& platform, std::shared_ptr<Condition> condition,
                            std::shared_ptr<bool> done, std::string waitingMessage,
                            std::string timeoutMessage, std::shared_ptr<const LogScope> log,
                            double timeout, std::function<void(bool)> completion);

}  // namespace qn
