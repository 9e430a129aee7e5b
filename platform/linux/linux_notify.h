#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "platform/log.h"
#include "platform/notify.h"

namespace qn {

// Statuses of Register and Post (0 is success).
inline constexpr std::uint32_t kNotifyStatusInvalidName = 1;   // empty, '/', "." or "..", too long
inline constexpr std::uint32_t kNotifyStatusInvalidQueue = 2;  // no queue or no handler
inline constexpr std::uint32_t kNotifyStatusFailed = 3;        // the folder or watch is unusable

struct LinuxNotifyOptions {
  // The runtime folder; notifications are files in <runtime_dir>/notify.
  std::string runtime_dir;
  // Where watch failures are reported; may be null.
  std::shared_ptr<Log> log;
};

// System-wide named notifications through a folder: posting NAME touches
// <runtime_dir>/notify/NAME (opens it for writing, creating it, and closes it), and every
// process watching the folder with inotify sees the close. This object watches on one
// thread of its own, started with the first registration; each event runs the handlers
// registered for the name, each on its queue with its token. Posts that arrive close
// together may be delivered once (inotify merges identical events); a lost-event overflow
// delivers every registered name once. Cancel waits for a handler of that registration
// that is running on another thread; called from the handler itself it returns at once.
// Safe to call from any thread. The destructor stops and joins the watch thread.
std::shared_ptr<Notify> NewLinuxNotify(LinuxNotifyOptions options);

// The file that stands for the notification `name` under `runtime_dir`.
std::string NotificationFile(const std::string& runtime_dir, const std::string& name);

// Posts `name` under `runtime_dir` without a Notify object (for the command-line tool).
// Returns 0 or a status above.
std::uint32_t PostNotification(const std::string& runtime_dir, const std::string& name);

}  // namespace qn
