#include "platform/linux/linux_dispatch.h"

#include <pthread.h>

#include <algorithm>
#include <asio.hpp>
#include <cassert>
#include <deque>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace qn {
namespace {

class Core;

// The queue whose task the calling thread is running, if any.
thread_local const SerialQueue* tls_current_queue = nullptr;
// The core whose pool the calling thread belongs to, if any.
thread_local const Core* tls_pool_core = nullptr;

// What queues, conditions and the dispatcher share: the io_context and its pool, behind a
// gate. Every use of the io_context (posting, starting or cancelling a timer) happens under
// the gate's shared lock and only while the core accepts work, so that the dispatcher's
// destructor can close the gate and then destroy the io_context with its pending handlers
// while queues and conditions that outlive it carry on dropping work. Safe from any thread.
class Core {
 public:
  Core() : io_(std::in_place), guard_(asio::make_work_guard(*io_)) {}

  // The body of a pool thread: runs handlers until the core stops.
  void Run() {
    tls_pool_core = this;
    io_->run();
    tls_pool_core = nullptr;
  }

  bool IsPoolThread() const { return tls_pool_core == this; }

  // Runs `fn` on a pool thread. Returns false (dropping fn) once the core has stopped.
  template <typename Fn>
  bool Post(Fn&& fn) {
    std::shared_lock lock(gate_);
    if (!accepting_) return false;
    asio::post(*io_, std::forward<Fn>(fn));
    return true;
  }

  // Runs `fn` on a pool thread once `deadline` has passed, unless the timer is cancelled.
  // Stores a handle for CancelTimer in *timer when given. Returns false once stopped.
  template <typename Fn>
  bool StartTimer(SteadyTime deadline, Fn&& fn,
                  std::weak_ptr<asio::steady_timer>* timer = nullptr) {
    std::shared_lock lock(gate_);
    if (!accepting_) return false;
    auto t = std::make_shared<asio::steady_timer>(*io_, deadline);
    if (timer) *timer = t;
    // The handler owns the timer: it lives until it fires, is cancelled, or the pending
    // handlers are destroyed with the io_context.
    t->async_wait([t, fn = std::forward<Fn>(fn)](const std::error_code& ec) mutable {
      if (!ec) fn();
    });
    return true;
  }

  // Cancels a timer started by StartTimer; its function is then not run.
  // REQUIRES: calls for the same timer are serialised by the caller.
  void CancelTimer(const std::weak_ptr<asio::steady_timer>& timer) {
    std::shared_lock lock(gate_);
    if (!accepting_) return;
    if (auto t = timer.lock()) t->cancel();
  }

  // Closes the gate and stops the pool threads after the handlers they are running.
  void Stop() {
    {
      std::unique_lock lock(gate_);
      accepting_ = false;
    }
    guard_.reset();
    io_->stop();
  }

  // Destroys every pending handler (and with it the tasks, timers and waiters it holds)
  // without running it. REQUIRES: Stop() was called and the pool threads have ended.
  void DestroyPending() { io_.reset(); }

 private:
  std::shared_mutex gate_;
  bool accepting_ = true;  // guarded by gate_
  std::optional<asio::io_context> io_;
  asio::executor_work_guard<asio::io_context::executor_type> guard_;
};

// A serial executor on the pool: a task deque drained by at most one pool thread at a
// time ("scheduled"), a bounded batch per turn, then re-posted so that other queues get
// the thread. A suspended queue posts nothing and so holds no thread.
class LinuxSerialQueue final : public SerialQueue,
                               public std::enable_shared_from_this<LinuxSerialQueue> {
 public:
  LinuxSerialQueue(std::shared_ptr<Core> core, std::string label, QualityOfService qos, int batch)
      : core_(std::move(core)), label_(std::move(label)), qos_(qos), batch_(batch) {}

  void Async(Task task) override {
    if (!task) return;
    {
      std::lock_guard lock(mu_);
      tasks_.push_back(std::move(task));
      if (scheduled_ || suspended_ > 0) return;
      scheduled_ = true;
    }
    Schedule();
  }

  void AsyncOrRun(Task task) override {
    if (!task) return;
    {
      std::lock_guard lock(mu_);
      const bool idle = !scheduled_ && suspended_ == 0 && tasks_.empty();
      if (!idle) {
        tasks_.push_back(std::move(task));
        if (scheduled_ || suspended_ > 0) return;
      }
      scheduled_ = true;  // held by this call (idle) or by the drain turn posted below
      if (!idle) task = nullptr;
    }
    if (!task) {
      Schedule();
      return;
    }
    const SerialQueue* outer = tls_current_queue;
    tls_current_queue = this;
    task();
    tls_current_queue = outer;
    EndTurn();  // what arrived meanwhile runs on the pool
  }

  void AsyncAfter(Duration delay, Task task) override {
    if (!task) return;
    if (delay <= Duration::zero()) {
      Async(std::move(task));
      return;
    }
    core_->StartTimer(std::chrono::steady_clock::now() + delay,
                      [self = shared_from_this(), task = std::move(task)]() mutable {
                        self->Async(std::move(task));
                      });
  }

  void Suspend() override {
    std::lock_guard lock(mu_);
    ++suspended_;
  }

  void Resume() override {
    {
      std::lock_guard lock(mu_);
      assert(suspended_ > 0 && "Resume without a matching Suspend");
      if (suspended_ == 0) return;
      if (--suspended_ > 0 || scheduled_ || tasks_.empty()) return;
      scheduled_ = true;
    }
    Schedule();
  }

  bool IsCurrent() const override { return tls_current_queue == this; }

  const std::string& label() const override { return label_; }

 private:
  // Posts a drain turn. REQUIRES: the caller has just set scheduled_.
  void Schedule() {
    if (core_->Post([self = shared_from_this()] { self->Drain(); })) return;
    // The dispatcher is gone: nothing will ever run here again, so drop the tasks.
    std::deque<Task> dropped;
    std::lock_guard lock(mu_);
    dropped.swap(tasks_);
    scheduled_ = false;
  }

  // One turn on a pool thread: runs up to batch_ tasks, then yields.
  void Drain() {
    const SerialQueue* outer = tls_current_queue;
    tls_current_queue = this;
    for (int i = 0; i < batch_; ++i) {
      Task task;
      {
        std::lock_guard lock(mu_);
        if (suspended_ > 0 || tasks_.empty()) {
          scheduled_ = false;
          tls_current_queue = outer;
          return;
        }
        task = std::move(tasks_.front());
        tasks_.pop_front();
      }
      task();
    }
    tls_current_queue = outer;
    EndTurn();  // more work: go to the back of the pool's line
  }

  // Ends a turn: lets the queue go when it has nothing to run, else posts the next turn.
  void EndTurn() {
    {
      std::lock_guard lock(mu_);
      if (suspended_ > 0 || tasks_.empty()) {
        scheduled_ = false;
        return;
      }
    }
    Schedule();
  }

  const std::shared_ptr<Core> core_;
  const std::string label_;
  [[maybe_unused]] const QualityOfService qos_;
  const int batch_;

  std::mutex mu_;
  std::deque<Task> tasks_;  // guarded by mu_
  bool scheduled_ = false;  // guarded by mu_: a drain turn is posted or running
  int suspended_ = 0;       // guarded by mu_
};

// The condition's state, shared with its deadline timer's handler so that a waiter
// registered on a condition that is then destroyed still gets its deadline call.
struct ConditionState {
  explicit ConditionState(std::shared_ptr<Core> c) : core(std::move(c)) {}

  // Fired by the deadline timer of waiter `generation`.
  void OnDeadline(std::uint64_t waiter_generation) {
    std::function<void(bool)> fire;
    {
      std::lock_guard lock(mu);
      if (waiter_generation != generation || !done) return;  // signalled first
      fire = std::move(done);
      done = nullptr;
    }
    fire(true);
  }

  const std::shared_ptr<Core> core;
  std::mutex mu;  // the condition's lock, also guarding the fields below
  std::function<void(bool)> done;
  std::uint64_t generation = 0;  // of the registered waiter
  std::weak_ptr<asio::steady_timer> timer;
};

class LinuxCondition final : public Condition {
 public:
  explicit LinuxCondition(std::shared_ptr<Core> core)
      : state_(std::make_shared<ConditionState>(std::move(core))) {}

  void lock() override { state_->mu.lock(); }
  void unlock() override { state_->mu.unlock(); }

  void WaitUntil(SteadyTime deadline, std::function<void(bool timed_out)> done) override {
    ConditionState& s = *state_;
    assert(!s.done && "one waiter at a time");
    if (s.done) {
      // A second waiter replaces the first; the first must not be left hanging.
      s.core->CancelTimer(s.timer);
      s.core->Post([old = std::move(s.done)] { old(true); });
    }
    s.done = std::move(done);
    const std::uint64_t generation = ++s.generation;
    s.core->StartTimer(
        deadline, [state = state_, generation] { state->OnDeadline(generation); }, &s.timer);
  }

  void Signal() override {
    ConditionState& s = *state_;
    if (!s.done) return;
    ++s.generation;  // the deadline handler, if it already fired, now finds nothing to do
    s.core->CancelTimer(s.timer);
    s.core->Post([fire = std::move(s.done)] { fire(false); });
    s.done = nullptr;
  }

 private:
  std::shared_ptr<ConditionState> state_;
};

class LinuxDispatcher final : public Dispatcher {
 public:
  explicit LinuxDispatcher(const LinuxDispatcherOptions& options)
      : core_(std::make_shared<Core>()), batch_(std::max(1, options.batch)) {
    int n = options.threads;
    if (n <= 0) n = std::max(2, static_cast<int>(std::thread::hardware_concurrency()));
    threads_.reserve(n);
    for (int i = 0; i < n; ++i) {
      threads_.emplace_back([core = core_.get(), i] {
        const std::string name = "qn-dispatch-" + std::to_string(i);
        pthread_setname_np(pthread_self(), name.c_str());
        core->Run();
      });
    }
  }

  ~LinuxDispatcher() override {
    assert(!core_->IsPoolThread() && "the dispatcher is destroyed from one of its tasks");
    core_->Stop();
    for (auto& t : threads_) t.join();
    core_->DestroyPending();
  }

  std::shared_ptr<SerialQueue> CreateSerialQueue(std::string label, QualityOfService qos) override {
    return std::make_shared<LinuxSerialQueue>(core_, std::move(label), qos, batch_);
  }

  void AsyncGlobal(QualityOfService /*qos*/, Duration delay, Task task) override {
    if (!task) return;
    if (delay <= Duration::zero()) {
      core_->Post(std::move(task));
    } else {
      core_->StartTimer(Now() + delay, std::move(task));
    }
  }

  std::unique_ptr<Condition> CreateCondition() override {
    return std::make_unique<LinuxCondition>(core_);
  }

  SteadyTime Now() const override { return std::chrono::steady_clock::now(); }
  std::chrono::system_clock::time_point WallNow() const override {
    return std::chrono::system_clock::now();
  }

 private:
  const std::shared_ptr<Core> core_;
  const int batch_;
  std::vector<std::thread> threads_;
};

}  // namespace

std::shared_ptr<Dispatcher> NewLinuxDispatcher(LinuxDispatcherOptions options) {
  return std::make_shared<LinuxDispatcher>(options);
}

}  // namespace qn
