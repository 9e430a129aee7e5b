#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

#include "platform/dispatch.h"

namespace qn::testing {

// A deterministic Dispatcher for tests: nothing runs until the test says so, and time is a
// manual clock. RunUntilIdle runs every ready task (in submission order, honouring each
// serial queue's order and suspension); AdvanceBy moves the clock, firing timers in deadline
// order and running what they make ready. Tasks run on the thread that calls RunUntilIdle /
// AdvanceBy. Submitting is safe from any thread.
class FakeDispatcher final : public Dispatcher {
 public:
  std::shared_ptr<SerialQueue> CreateSerialQueue(std::string label, QualityOfService) override {
    auto state = std::make_shared<QueueState>();
    state->label = std::move(label);
    return std::make_shared<Queue>(*this, std::move(state));
  }
  void AsyncGlobal(QualityOfService, Duration delay, Task task) override {
    if (delay <= Duration::zero()) return Post(nullptr, std::move(task));
    AddTimer(Now() + delay,
             [this, task = std::move(task)]() mutable { Post(nullptr, std::move(task)); });
  }
  std::unique_ptr<Condition> CreateCondition() override {
    auto state = std::make_shared<ConditionState>();
    std::lock_guard g(mu_);
    conditions_.push_back(state);
    return std::make_unique<FakeCondition>(*this, std::move(state));
  }
  SteadyTime Now() const override {
    std::lock_guard g(mu_);
    return now_;
  }
  std::chrono::system_clock::time_point WallNow() const override {
    return wall_start_ + std::chrono::duration_cast<std::chrono::system_clock::duration>(
                             Now() - SteadyTime(kStart));
  }

  // Runs ready tasks until none is left; returns how many ran.
  int RunUntilIdle() {
    int ran = 0;
    while (RunOne()) ++ran;
    return ran;
  }
  // Advances the clock by `d`, firing due timers in order (running ready tasks after each).
  void AdvanceBy(Duration d) {
    const SteadyTime target = Now() + d;
    for (RunUntilIdle();; RunUntilIdle()) {
      Task task;
      {
        std::lock_guard g(mu_);
        auto it = timers_.begin();
        if (it == timers_.end() || it->first > target) {
          now_ = target;
          return;
        }
        now_ = it->first;
        task = std::move(it->second.second);
        timers_.erase(it);
      }
      task();
    }
  }
  // Wakes every waiting condition as a signal would, without anyone setting a flag: the
  // spurious wake-up of a framework that wakes its waiter without a result.
  void WakeAllConditions() {
    std::vector<std::shared_ptr<ConditionState>> live;
    {
      std::lock_guard g(mu_);
      for (auto& w : conditions_)
        if (auto s = w.lock()) live.push_back(std::move(s));
    }
    for (auto& s : live) {
      std::lock_guard user(s->lock);
      Fire(s, false);
    }
  }

 private:
  static constexpr std::chrono::hours kStart{1000};
  struct QueueState {
    std::string label;
    std::deque<Task> tasks;  // the rest guarded by the dispatcher's mutex
    int suspended = 0;
    int deferred = 0;  // turns that came up while suspended
  };
  struct ConditionState {
    std::mutex lock;   // the condition's user-visible lock
    std::mutex inner;  // guards waiter and timer
    std::function<void(bool)> waiter;
    std::uint64_t timer = 0;
  };
  static inline thread_local const QueueState* current_ = nullptr;

  class Queue final : public SerialQueue {
   public:
    Queue(FakeDispatcher& d, std::shared_ptr<QueueState> s) : d_(d), s_(std::move(s)) {}
    void Async(Task task) override { d_.Post(s_, std::move(task)); }
    // No product code submits delayed work to a serial queue; a use would need a test first.
    void AsyncAfter(Duration, Task) override {
      throw std::logic_error("FakeDispatcher: AsyncAfter");
    }
    void Suspend() override {
      std::lock_guard g(d_.mu_);
      s_->suspended++;
    }
    void Resume() override {
      std::lock_guard g(d_.mu_);
      if (s_->suspended == 0) throw std::logic_error("FakeDispatcher: Resume without Suspend");
      if (--s_->suspended > 0) return;
      for (; s_->deferred > 0; --s_->deferred) d_.ready_.emplace_back(s_, nullptr);
    }
    bool IsCurrent() const override { return current_ == s_.get(); }
    const std::string& label() const override { return s_->label; }

   private:
    FakeDispatcher& d_;
    std::shared_ptr<QueueState> s_;
  };

  class FakeCondition final : public Condition {
   public:
    FakeCondition(FakeDispatcher& d, std::shared_ptr<ConditionState> s) : d_(d), s_(std::move(s)) {}
    ~FakeCondition() override {
      std::lock_guard g(s_->inner);
      if (s_->timer) d_.CancelTimer(s_->timer);
      s_->waiter = nullptr;
    }
    void lock() override { s_->lock.lock(); }
    void unlock() override { s_->lock.unlock(); }
    void WaitUntil(SteadyTime deadline, std::function<void(bool)> done) override {
      std::lock_guard g(s_->inner);
      if (s_->waiter) throw std::logic_error("FakeCondition: one waiter at a time");
      s_->waiter = std::move(done);
      s_->timer = d_.AddTimer(deadline, [d = &d_, weak = std::weak_ptr(s_)] {
        if (auto s = weak.lock()) d->Fire(s, true);
      });
    }
    void Signal() override { d_.Fire(s_, false); }

   private:
    FakeDispatcher& d_;
    std::shared_ptr<ConditionState> s_;
  };

  // Hands a condition's waiter its result: at once for a deadline (already on the
  // dispatcher's thread), through a global task for a signal (signals come from any thread).
  void Fire(const std::shared_ptr<ConditionState>& s, bool timed_out) {
    std::function<void(bool)> waiter;
    {
      std::lock_guard g(s->inner);
      if (!s->waiter) return;
      waiter = std::move(s->waiter);
      s->waiter = nullptr;
      if (!timed_out && s->timer) CancelTimer(s->timer);
      s->timer = 0;
    }
    if (timed_out) return waiter(true);
    Post(nullptr, [waiter = std::move(waiter)] { waiter(false); });
  }
  // Queues `task` on `queue`, or as a global task when it is null.
  void Post(const std::shared_ptr<QueueState>& queue, Task task) {
    std::lock_guard g(mu_);
    if (queue) queue->tasks.push_back(std::move(task));
    ready_.emplace_back(queue, queue ? nullptr : std::move(task));
  }
  std::uint64_t AddTimer(SteadyTime when, Task task) {
    std::lock_guard g(mu_);
    timers_.emplace(when, std::make_pair(++last_timer_, std::move(task)));
    return last_timer_;
  }
  void CancelTimer(std::uint64_t id) {
    std::lock_guard g(mu_);
    std::erase_if(timers_, [id](const auto& t) { return t.second.first == id; });
  }
  bool RunOne() {
    Task task;
    std::shared_ptr<QueueState> queue;
    {
      std::lock_guard g(mu_);
      if (ready_.empty()) return false;
      std::tie(queue, task) = std::move(ready_.front());
      ready_.pop_front();
      if (queue && queue->suspended > 0) return ++queue->deferred, true;
      if (queue) task = std::move(queue->tasks.front()), queue->tasks.pop_front();
    }
    // Restores the running queue even when the task throws (FakeProcess::Exit does).
    struct Running {
      const QueueState* outer = current_;
      explicit Running(const QueueState* q) { current_ = q; }
      ~Running() { current_ = outer; }
    } running(queue.get());
    task();
    return true;
  }

  mutable std::mutex mu_;
  std::deque<std::pair<std::shared_ptr<QueueState>, Task>> ready_;  // null queue: global task
  std::multimap<SteadyTime, std::pair<std::uint64_t, Task>> timers_;
  std::uint64_t last_timer_ = 0;
  SteadyTime now_{kStart};
  const std::chrono::system_clock::time_point wall_start_ = std::chrono::system_clock::now();
  std::vector<std::weak_ptr<ConditionState>> conditions_;
};

}  // namespace qn::testing
