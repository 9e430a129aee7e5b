// The serial-queue contract run against the Linux dispatcher and its test double, and what
// only the Linux dispatcher promises: suspended queues hold no thread, a busy queue yields,
// and conditions with deadlines call their waiter back exactly once, off the caller's thread.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/linux/linux_dispatch.h"
#include "tests/fakes/FakeDispatcher.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

using std::chrono::milliseconds;

// Drives the real dispatcher: its pool runs on its own, so the harness only waits.
struct LinuxHarness {
  std::shared_ptr<Dispatcher> dispatcher = NewLinuxDispatcher({.threads = 2});

  // Waits until pred holds (false when patience runs out).
  bool RunUntil(const std::function<bool()>& pred) {
    const auto give_up = std::chrono::steady_clock::now() + testing::kPatience;
    while (!pred()) {
      if (std::chrono::steady_clock::now() > give_up) return false;
      std::this_thread::sleep_for(milliseconds(1));
    }
    return true;
  }
  // Gives work that could wrongly run a chance to do so, before a negative check.
  void RunPending() { std::this_thread::sleep_for(milliseconds(50)); }
};

// Drives the test double: tasks run on the test's thread when it runs them, and time
// moves only when the harness moves it.
struct FakeHarness {
  std::shared_ptr<testing::FakeDispatcher> fake = std::make_shared<testing::FakeDispatcher>();
  std::shared_ptr<Dispatcher> dispatcher = fake;

  bool RunUntil(const std::function<bool()>& pred) {
    // Steps of fake time, up to an hour of it.
    for (int step = 0; step < 360000; ++step) {
      fake->RunUntilIdle();
      if (pred()) return true;
      fake->AdvanceBy(milliseconds(10));
    }
    return false;
  }
  void RunPending() { fake->RunUntilIdle(); }
};

template <typename Harness>
class DispatchContractTest : public ::testing::Test {
 protected:
  Harness h_;
  Dispatcher& dispatcher() { return *h_.dispatcher; }
};

using DispatchHarnesses = ::testing::Types<LinuxHarness, FakeHarness>;
TYPED_TEST_SUITE(DispatchContractTest, DispatchHarnesses);

TYPED_TEST(DispatchContractTest, SerialOrderUnderConcurrentSubmitters) {
  auto queue = this->dispatcher().CreateSerialQueue("order", QualityOfService::kUtility);
  constexpr int kSubmitters = 4;
  constexpr int kPerSubmitter = 500;
  std::mutex mu;
  std::vector<std::vector<int>> seen(kSubmitters);
  std::atomic<int> running{0};
  std::atomic<int> overlaps{0};
  std::atomic<int> done{0};

  std::vector<std::thread> submitters;
  for (int s = 0; s < kSubmitters; ++s) {
    submitters.emplace_back([&, s] {
      for (int i = 0; i < kPerSubmitter; ++i) {
        queue->Async([&, s, i] {
          if (running.fetch_add(1) != 0) overlaps.fetch_add(1);
          {
            std::lock_guard lock(mu);
            seen[s].push_back(i);
          }
          running.fetch_sub(1);
          done.fetch_add(1);
        });
      }
    });
  }
  for (auto& t : submitters) t.join();
  ASSERT_TRUE(this->h_.RunUntil([&] { return done.load() == kSubmitters * kPerSubmitter; }));

  EXPECT_EQ(overlaps.load(), 0) << "two tasks of one serial queue ran at the same time";
  std::lock_guard lock(mu);
  for (int s = 0; s < kSubmitters; ++s) {
    ASSERT_EQ(seen[s].size(), static_cast<size_t>(kPerSubmitter));
    for (int i = 0; i < kPerSubmitter; ++i) {
      ASSERT_EQ(seen[s][i], i) << "submitter " << s << " saw its tasks out of order";
    }
  }
}

// Suspensions count (one Resume does not undo two), and a task may suspend its own queue
// until work elsewhere resumes it, as a completion handler would. IsCurrent holds only inside
// the queue's own tasks.
TYPED_TEST(DispatchContractTest, SuspensionsCountAndATaskCanSuspendItsOwnQueue) {
  auto queue = this->dispatcher().CreateSerialQueue("self", QualityOfService::kUtility);
  std::mutex mu;
  std::vector<std::string> order;
  auto record = [&](std::string what) {
    std::lock_guard lock(mu);
    order.push_back(std::move(what));
  };
  auto recorded = [&] {
    std::lock_guard lock(mu);
    return order.size();
  };
  queue->Async([&, queue] {
    queue->Suspend();
    queue->Suspend();
    record(queue->IsCurrent() ? "first" : "first, not current");
  });
  queue->Async([&] { record("second"); });
  ASSERT_TRUE(this->h_.RunUntil([&] { return recorded() == 1; }));
  queue->Resume();
  this->h_.RunPending();
  EXPECT_EQ(recorded(), 1u) << "one Resume undid two Suspends";
  this->dispatcher().AsyncGlobal(QualityOfService::kUtility, milliseconds(20), [&, queue] {
    record(queue->IsCurrent() ? "resume, current" : "resume");
    queue->Resume();
  });
  ASSERT_TRUE(this->h_.RunUntil([&] { return recorded() == 3; }));
  EXPECT_EQ(order, (std::vector<std::string>{"first", "resume", "second"}));
  EXPECT_FALSE(queue->IsCurrent());
}

TYPED_TEST(DispatchContractTest, TasksQueuedWhenTheLastReferenceGoesStillRun) {
  auto queue = this->dispatcher().CreateSerialQueue("orphan", QualityOfService::kUtility);
  std::atomic<int> ran{0};
  for (int i = 0; i < 10; ++i) queue->Async([&] { ran.fetch_add(1); });
  queue.reset();
  EXPECT_TRUE(this->h_.RunUntil([&] { return ran.load() == 10; }));
}

using testing::Counter;

TEST(LinuxDispatchTest, SuspendedQueuesHoldNoThread) {
  auto dispatcher = NewLinuxDispatcher({.threads = 2});
  constexpr int kQueues = 1000;
  std::vector<std::shared_ptr<SerialQueue>> waiting;
  Counter suspended, held_ran, busy_ran;
  for (int i = 0; i < kQueues; ++i) {
    auto q = dispatcher->CreateSerialQueue("waiting", QualityOfService::kUtility);
    // Each queue's first task parks the queue, as a task waiting for a backend does.
    q->Async([&suspended, raw = q.get()] {
      raw->Suspend();
      suspended.Add();
    });
    q->Async([&held_ran] { held_ran.Add(); });
    waiting.push_back(q);
  }
  ASSERT_TRUE(suspended.WaitFor(kQueues));

  auto busy = dispatcher->CreateSerialQueue("busy", QualityOfService::kUtility);
  for (int i = 0; i < 1000; ++i) busy->Async([&] { busy_ran.Add(); });
  ASSERT_TRUE(busy_ran.WaitFor(1000)) << "parked queues starved another queue";
  EXPECT_EQ(held_ran.value(), 0) << "a suspended queue ran a later task";
  for (auto& q : waiting) q->Resume();
  EXPECT_TRUE(held_ran.WaitFor(kQueues));
}

// AsyncOrRun runs a task at once, on the caller's thread, as the queue's task, only when the
// queue is idle; behind a suspension (or queued work) it waits its turn like Async.
TEST(LinuxDispatchTest, AsyncOrRunRunsAtOnceOnlyOnAnIdleQueue) {
  auto dispatcher = NewLinuxDispatcher({.threads = 2});
  auto queue = dispatcher->CreateSerialQueue("q", QualityOfService::kUserInteractive);
  std::vector<int> order;  // written by the queue's tasks only
  bool current = false;
  queue->AsyncOrRun([&] {
    current = queue->IsCurrent();
    order.push_back(1);
  });
  EXPECT_TRUE(current);
  queue->Suspend();
  queue->AsyncOrRun([&] { order.push_back(2); });
  EXPECT_EQ(order.size(), 1u);
  queue->AsyncOrRun([&] { order.push_back(3); });
  Counter done;
  queue->Async([&] { done.Add(); });
  queue->Resume();
  ASSERT_TRUE(done.WaitFor(1));
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
}

// A queue with a long backlog runs a bounded batch per turn, so that another queue gets the
// only thread before the backlog is done.
TEST(LinuxDispatchTest, BusyQueueYieldsToOthersOnASingleThread) {
  auto dispatcher = NewLinuxDispatcher({.threads = 1, .batch = 8});
  auto flood = dispatcher->CreateSerialQueue("flood", QualityOfService::kUtility);
  auto other = dispatcher->CreateSerialQueue("other", QualityOfService::kUtility);
  constexpr int kFlood = 10000;
  std::atomic<int> flood_ran{0}, flood_when_other_ran{-1};
  std::atomic<bool> other_submitted{false};
  Counter finished;
  // The flood's first task holds the thread until `other` has work.
  flood->Async([&] {
    const auto give_up = std::chrono::steady_clock::now() + testing::kPatience;
    while (!other_submitted && std::chrono::steady_clock::now() < give_up) {
      std::this_thread::yield();
    }
  });
  for (int i = 0; i < kFlood; ++i) {
    flood->Async([&] {
      if (flood_ran.fetch_add(1) + 1 == kFlood) finished.Add();
    });
  }
  other->Async([&] {
    flood_when_other_ran = flood_ran.load();
    finished.Add();
  });
  other_submitted = true;
  ASSERT_TRUE(finished.WaitFor(2));
  EXPECT_LT(flood_when_other_ran.load(), kFlood) << "a busy queue kept the only thread";
}

// Rounds whose deadline is far, already past, or racing the signal: each waiter is called
// once, with "timed out" exactly when no signal came first, never on the caller's thread,
// and never while the caller holds the condition's lock (the callback takes it).
TEST(LinuxConditionTest, EachWaiterIsCalledBackExactlyOnce) {
  auto dispatcher = NewLinuxDispatcher({.threads = 2});
  auto condition = dispatcher->CreateCondition();
  struct Waiter {
    Counter calls;
    std::atomic<int> timed_out{-1};
    std::atomic<bool> on_caller_thread{false};
  };
  constexpr int kRounds = 100;
  std::vector<std::unique_ptr<Waiter>> waiters;
  for (int round = 0; round < kRounds + 2; ++round) {
    Waiter& w = *waiters.emplace_back(std::make_unique<Waiter>());
    const auto deadline = round == 0   ? std::chrono::hours(1)
                          : round == 1 ? std::chrono::microseconds(0)
                                       : std::chrono::microseconds(round * 5);
    const auto caller = std::this_thread::get_id();
    condition->lock();
    condition->WaitUntil(dispatcher->Now() + deadline, [&, caller](bool t) {
      w.on_caller_thread = std::this_thread::get_id() == caller;
      condition->lock();
      condition->unlock();
      w.timed_out = t ? 1 : 0;
      w.calls.Add();
    });
    if (round == 0) condition->Signal();
    condition->unlock();
    if (round == 1) {
      ASSERT_TRUE(w.calls.WaitFor(1));  // the late signal below is lost
    }
    std::this_thread::sleep_for(std::chrono::microseconds(500));
    condition->lock();
    condition->Signal();
    condition->unlock();
    ASSERT_TRUE(w.calls.WaitFor(1));
  }
  std::this_thread::sleep_for(milliseconds(50));
  for (auto& w : waiters) {
    EXPECT_EQ(w->calls.value(), 1);
    EXPECT_FALSE(w->on_caller_thread.load());
  }
  EXPECT_EQ(waiters[0]->timed_out.load(), 0);
  EXPECT_EQ(waiters[1]->timed_out.load(), 1);
}

}  // namespace
}  // namespace qn
