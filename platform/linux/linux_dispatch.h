#pragma once

#include <memory>

#include "platform/dispatch.h"

namespace qn {

struct LinuxDispatcherOptions {
  // Threads of the shared pool; 0 = max(2, hardware concurrency).
  int threads = 0;
  // Tasks a serial queue runs in one turn before it yields its thread to other work.
  int batch = 32;
};

// The dispatcher on asio: one io_context served by a fixed pool of threads. Serial queues
// are serial executors on that pool (no thread of their own): a queue with work holds at
// most one pool thread while it runs a batch, and a suspended queue holds none. Delayed
// submissions and condition deadlines are asio steady_timers.
//
// Destruction: the destructor stops accepting work (later submissions are dropped), lets
// the tasks already running finish, starts nothing new, joins the pool and then destroys
// every pending task, timer and condition waiter without running it. Queues and conditions
// may outlive the dispatcher; they then accept and drop work.
// REQUIRES: the dispatcher is not destroyed from one of its own tasks.
std::shared_ptr<Dispatcher> NewLinuxDispatcher(LinuxDispatcherOptions options = {});

}  // namespace qn
