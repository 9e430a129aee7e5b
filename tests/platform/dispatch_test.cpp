// What only the Linux dispatcher promises: suspended queues hold no thread, a busy queue
// yields, and conditions with deadlines call their waiter back exactly once, off the
// caller's thread.

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "platform/linux/linux_dispatch.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

using std::chrono::milliseconds;
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
