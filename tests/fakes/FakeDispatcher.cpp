#include "tests/fakes/FakeDispatcher.h"

#include <functional>
#include <stdexcept>

namespace qn::testing {

static thread_local const FakeDispatcher::QueueState* current_queue = nullptr;

struct FakeDispatcher::QueueState {
  std::string label;
  std::deque<Task> tasks;  // guarded by the dispatcher's mutex
  int suspended = 0;
  int deferred = 0;  // tokens that came up while suspended
};

struct FakeDispatcher::ConditionState {
  std::mutex lock;   // the condition's user-visible lock
  std::mutex inner;  // guards waiter and timer
  std::function<void(bool)> waiter;
  std::uint64_t timer = 0;
};

namespace {

class FakeSerialQueue final : public SerialQueue {
 public:
  FakeSerialQueue(FakeDispatcher& d, std::shared_ptr<FakeDispatcher::QueueState> s)
      : d_(d), s_(std::move(s)) {}
  void Async(Task task) override { d_.Post(s_, std::move(task)); }
  void AsyncAfter(Duration delay, Task task) override {
    auto s = s_;
    FakeDispatcher* d = &d_;
    d_.AddTimer(d_.Now() + delay,
                [d, s, task = std::move(task)]() mutable { d->Post(s, std::move(task)); });
  }
  void Suspend() override { d_.SuspendQueue(s_); }
  void Resume() override { d_.ResumeQueue(s_); }
  bool IsCurrent() const override { return current_queue == s_.get(); }
  const std::string& label() const override { return s_->label; }

 private:
  FakeDispatcher& d_;
  std::shared_ptr<FakeDispatcher::QueueState> s_;
};

class FakeCondition final : public Condition {
 public:
  FakeCondition(FakeDispatcher& d, std::shared_ptr<FakeDispatcher::ConditionState> s)
      : d_(d), s_(std::move(s)) {}
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
    std::weak_ptr<FakeDispatcher::ConditionState> weak = s_;
    s_->timer = d_.AddTimer(deadline, [weak] { Fire(weak, true, nullptr); });
  }
  void Signal() override { Fire(s_, false, &d_); }

  // Hands the waiter its result: at once for a deadline (already on the dispatcher's
  // thread), through a global task for a signal (signals come from any thread).
  static void Fire(std::weak_ptr<FakeDispatcher::ConditionState> weak, bool timed_out,
                   FakeDispatcher* d) {
    auto s = weak.lock();
    if (!s) return;
    std::function<void(bool)> waiter;
    {
      std::lock_guard g(s->inner);
      if (!s->waiter) return;
      waiter = std::move(s->waiter);
      s->waiter = nullptr;
      if (!timed_out && s->timer) d->CancelTimer(s->timer);
      s->timer = 0;
    }
    if (timed_out) {
      waiter(true);
    } else {
      d->AsyncGlobal(QualityOfService::kUtility, Duration::zero(),
                     [waiter = std::move(waiter)] { waiter(false); });
    }
  }

 private:
  FakeDispatcher& d_;
  std::shared_ptr<FakeDispatcher::ConditionState> s_;
};

}  // namespace

FakeDispatcher::FakeDispatcher()
    : now_(SteadyTime(std::chrono::hours(1000))),
      wall_start_(std::chrono::system_clock::now()),
      steady_start_(now_) {}

FakeDispatcher::~FakeDispatcher() = default;

std::shared_ptr<SerialQueue> FakeDispatcher::CreateSerialQueue(std::string label,
                                                               QualityOfService) {
  auto state = std::make_shared<QueueState>();
  state->label = std::move(label);
  return std::make_shared<FakeSerialQueue>(*this, std::move(state));
}

void FakeDispatcher::AsyncGlobal(QualityOfService, Duration delay, Task task) {
  if (delay > Duration::zero()) {
    AddTimer(Now() + delay, [this, task = std::move(task)]() mutable {
      AsyncGlobal(QualityOfService::kBackground, Duration::zero(), std::move(task));
    });
    return;
  }
  std::lock_guard g(mu_);
  ready_.push_back(Item{nullptr, std::move(task)});
}

std::unique_ptr<Condition> FakeDispatcher::CreateCondition() {
  auto state = std::make_shared<ConditionState>();
  {
    std::lock_guard g(mu_);
    conditions_.push_back(state);
  }
  return std::make_unique<FakeCondition>(*this, std::move(state));
}

SteadyTime FakeDispatcher::Now() const {
  std::lock_guard g(mu_);
  return now_;
}

std::chrono::system_clock::time_point FakeDispatcher::WallNow() const {
  std::lock_guard g(mu_);
  return wall_start_ +
         std::chrono::duration_cast<std::chrono::system_clock::duration>(now_ - steady_start_);
}

void FakeDispatcher::Post(std::shared_ptr<QueueState> queue, Task task) {
  std::lock_guard g(mu_);
  queue->tasks.push_back(std::move(task));
  ready_.push_back(Item{std::move(queue), nullptr});
}

std::uint64_t FakeDispatcher::AddTimer(SteadyTime when, Task task) {
  std::lock_guard g(mu_);
  std::uint64_t id = next_timer_++;
  timers_.emplace(when, std::make_pair(id, std::move(task)));
  return id;
}

void FakeDispatcher::CancelTimer(std::uint64_t id) {
  std::lock_guard g(mu_);
  for (auto it = timers_.begin(); it != timers_.end(); ++it) {
    if (it->second.first == id) {
      timers_.erase(it);
      return;
    }
  }
}

bool FakeDispatcher::RunOne() {
  Task task;
  std::shared_ptr<QueueState> queue;
  {
    std::lock_guard g(mu_);
    if (ready_.empty()) return false;
    Item item = std::move(ready_.front());
    ready_.pop_front();
    queue = std::move(item.queue);
    if (!queue) {
      task = std::move(item.task);
    } else if (queue->suspended > 0) {
      queue->deferred++;
      return true;
    } else {
      task = std::move(queue->tasks.front());
      queue->tasks.pop_front();
    }
  }
  // Restores the running queue even when the task throws (FakeProcess::Exit does).
  struct CurrentQueue {
    const QueueState* outer = current_queue;
    explicit CurrentQueue(const QueueState* q) { current_queue = q; }
    ~CurrentQueue() { current_queue = outer; }
  } running(queue.get());
  task();
  return true;
}

int FakeDispatcher::RunUntilIdle() {
  int ran = 0;
  while (RunOne()) ++ran;
  return ran;
}

void FakeDispatcher::AdvanceBy(Duration d) {
  SteadyTime target;
  {
    std::lock_guard g(mu_);
    target = now_ + d;
  }
  RunUntilIdle();
  for (;;) {
    Task task;
    {
      std::lock_guard g(mu_);
      auto it = timers_.begin();
      if (it == timers_.end() || it->first > target) {
        now_ = target;
        break;
      }
      now_ = it->first;
      task = std::move(it->second.second);
      timers_.erase(it);
    }
    task();
    RunUntilIdle();
  }
  RunUntilIdle();
}

void FakeDispatcher::WakeAllConditions() {
  std::vector<std::shared_ptr<ConditionState>> live;
  {
    std::lock_guard g(mu_);
    for (auto& w : conditions_) {
      if (auto s = w.lock()) live.push_back(std::move(s));
    }
  }
  for (auto& s : live) {
    std::lock_guard user(s->lock);
    FakeCondition::Fire(s, false, this);
  }
}

void FakeDispatcher::SuspendQueue(const std::shared_ptr<QueueState>& queue) {
  std::lock_guard g(mu_);
  queue->suspended++;
}

void FakeDispatcher::ResumeQueue(const std::shared_ptr<QueueState>& queue) {
  std::lock_guard g(mu_);
  if (queue->suspended == 0) throw std::logic_error("FakeSerialQueue: Resume without Suspend");
  if (--queue->suspended > 0) return;
  for (; queue->deferred > 0; --queue->deferred) ready_.push_back(Item{queue, nullptr});
}

}  // namespace qn::testing
