#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace qn {

using Task = std::function<void()>;
using SteadyTime = std::chrono::steady_clock::time_point;
using Duration = std::chrono::steady_clock::duration;

// Quality-of-service classes of the queues. The Linux dispatcher records the class (it is
// part of a queue's description); it gives no queue priority over another.
enum class QualityOfService { kUserInteractive, kUtility, kBackground };

// A serial queue: tasks run one at a time, in submission order, on threads of a shared
// pool (no thread of its own). Safe to call from any thread.
class SerialQueue {
 public:
  virtual ~SerialQueue() = default;

  // Runs `task` after every task submitted before it. Tasks still queued when the last
  // reference to the queue goes away are still run.
  virtual void Async(Task task) = 0;

  // Runs `task` as Async would, except that when the queue is idle (nothing queued or
  // running, not suspended) it runs it at once on the calling thread, holding the queue
  // meanwhile, so that order and one-at-a-time still hold and the hand-off to another
  // thread is saved. For callers whose thread may do the queue's work (it must not hold a
  // lock the task takes). The default queues it.
  virtual void AsyncOrRun(Task task) { Async(std::move(task)); }

  // Submits `task` (as Async would) once `delay` has passed.
  virtual void AsyncAfter(Duration delay, Task task) = 0;

  // Suspend stops the queue from starting further tasks (the running one finishes);
  // Resume undoes one Suspend. Suspensions count: the queue runs again when every Suspend
  // has been matched. A task may suspend its own queue to hold it while it waits for
  // something asynchronously, without holding a thread.
  // REQUIRES: Resume is called at most as often as Suspend.
  virtual void Suspend() = 0;
  virtual void Resume() = 0;

  // Whether the calling thread is running a task of this queue.
  virtual bool IsCurrent() const = 0;

  virtual const std::string& label() const = 0;
};

// A condition variable with its own lock, for waits that must not hold a thread: a
// waiter registers a callback that runs when the condition is signalled or its deadline
// passes. Safe to call from any thread.
class Condition {
 public:
  virtual ~Condition() = default;

  // The condition's lock (BasicLockable). Whoever sets the state that a waiter checks
  // sets it while holding this lock, and signals while still holding it.
  virtual void lock() = 0;
  virtual void unlock() = 0;

  // Registers `done` to be called once, on a dispatcher thread and without the lock held,
  // with false when the condition was signalled and true when `deadline` passed first.
  // REQUIRES: the caller holds the lock (so a signal cannot slip in between the caller's
  // check of its state and the registration). One waiter at a time.
  virtual void WaitUntil(SteadyTime deadline, std::function<void(bool timed_out)> done) = 0;

  // Wakes the registered waiter, if any. A signal with no waiter is lost.
  // REQUIRES: the caller holds the lock.
  virtual void Signal() = 0;
};

// Dispatch queues: serial queues, the global concurrent queues, conditions and clocks.
// Safe to call from any thread.
class Dispatcher {
 public:
  virtual ~Dispatcher() = default;

  virtual std::shared_ptr<SerialQueue> CreateSerialQueue(std::string label,
                                                         QualityOfService qos) = 0;

  // Runs `task` on the global concurrent queue of that class after `delay` (0 = at once).
  // Tasks submitted this way may run concurrently with each other.
  virtual void AsyncGlobal(QualityOfService qos, Duration delay, Task task) = 0;

  virtual std::unique_ptr<Condition> CreateCondition() = 0;

  // The dispatcher's monotonic clock (what deadlines are measured against) and wall clock.
  virtual SteadyTime Now() const = 0;
  virtual std::chrono::system_clock::time_point WallNow() const = 0;
};

}  // namespace qn
