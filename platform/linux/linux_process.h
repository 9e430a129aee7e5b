#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/process.h"

namespace qn {

// Process information from /proc, and exit. `shutdown` runs in Exit before the process
// ends (the daemon drains its reporting store there); it may be empty.
//
// Exit runs `shutdown` once, flushes stdio and ends the process with _exit(status): other
// threads are running, so static destructors and atexit handlers are not run. A second
// Exit from another thread waits for the first (which never returns); an Exit from within
// `shutdown` skips the shutdown and ends the process at once.
// Safe to call from any thread.
std::shared_ptr<Process> NewLinuxProcess(std::function<void()> shutdown = {});

// The kernel's command name (comm) of `pid`: /proc/<pid>/comm without its newline, at most
// 16 bytes. nullopt for pid <= 0, a process that does not exist or cannot be read.
std::optional<std::string> ProcessCommandName(pid_t pid);

}  // namespace qn
