#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "platform/dispatch.h"

namespace qn::testing {

// A deterministic Dispatcher for tests: nothing runs until the test says so, and time is a
// manual clock. RunUntilIdle runs every task that is ready (in submission order, honouring
// each serial queue's order and suspension); AdvanceBy moves the clock, firing timers in
// deadline order and running what they make ready. Tasks run on the thread that calls
// RunUntilIdle/AdvanceBy. Submitting is safe from any thread.
class FakeDispatcher final : public Dispatcher {
 public:
  FakeDispatcher();
  ~FakeDispatcher() override;

  std::shared_ptr<SerialQueue> CreateSerialQueue(std::string label, QualityOfService qos) override;
  void AsyncGlobal(QualityOfService qos, Duration delay, Task task) override;
  std::unique_ptr<Condition> CreateCondition() override;
  SteadyTime Now() const override;
  std::chrono::system_clock::time_point WallNow() const override;

  // Runs ready tasks until none is left; returns how many ran.
  int RunUntilIdle();
  // Advances the clock by `d`, firing due timers in order (running ready tasks after each).
  void AdvanceBy(Duration d);
  // Wakes every waiting condition as a signal would (without anyone setting a flag): a
  // spurious wake-up, as a framework that wakes its waiter without result would cause.
  void WakeAllConditions();

  // Internals shared with the queue and condition implementations.
  struct QueueState;
  struct ConditionState;
  void Post(std::shared_ptr<QueueState> queue, Task task);
  std::uint64_t AddTimer(SteadyTime when, Task task);
  void CancelTimer(std::uint64_t id);
  void SuspendQueue(const std::shared_ptr<QueueState>& queue);
  void ResumeQueue(const std::shared_ptr<QueueState>& queue);

 private:
  struct Item {
    std::shared_ptr<QueueState> queue;  // null: a global task
    Task task;                          // global tasks only
  };
  bool RunOne();

  mutable std::mutex mu_;
  std::deque<Item> ready_;
  std::multimap<SteadyTime, std::pair<std::uint64_t, Task>> timers_;
  std::uint64_t next_timer_ = 1;
  SteadyTime now_;
  std::chrono::system_clock::time_point wall_start_;
  SteadyTime steady_start_;
  std::vector<std::weak_ptr<ConditionState>> conditions_;
};

}  // namespace qn::testing
