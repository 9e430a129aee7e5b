// The serial-queue contract, run against every Dispatcher the project has: the Linux one
// on its thread pool and the test double.

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
  // Lets `d` of dispatcher time pass.
  void Advance(Duration d) { std::this_thread::sleep_for(d); }
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
  void Advance(Duration d) { fake->AdvanceBy(d); }
};

template <typename Harness>
class DispatchContractTest : public ::testing::Test {
 protected:
  Harness h_;
  Dispatcher& dispatcher() { return *h_.dispatcher; }
};

using Harnesses = ::testing::Types<LinuxHarness, FakeHarness>;
TYPED_TEST_SUITE(DispatchContractTest, Harnesses);

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

TYPED_TEST(DispatchContractTest, SuspensionsCountAndHoldLaterTasks) {
  auto queue = this->dispatcher().CreateSerialQueue("suspend", QualityOfService::kUtility);
  std::atomic<int> ran{0};
  queue->Suspend();
  queue->Suspend();
  queue->Async([&] { ran.fetch_add(1); });
  this->h_.RunPending();
  EXPECT_EQ(ran.load(), 0);

  queue->Resume();
  this->h_.RunPending();
  EXPECT_EQ(ran.load(), 0) << "one Resume undid two Suspends";

  queue->Resume();
  EXPECT_TRUE(this->h_.RunUntil([&] { return ran.load() == 1; }));
}

TYPED_TEST(DispatchContractTest, TaskSuspendsItsOwnQueueUntilResumedElsewhere) {
  auto queue = this->dispatcher().CreateSerialQueue("self", QualityOfService::kUtility);
  std::mutex mu;
  std::vector<std::string> order;
  auto record = [&](std::string what) {
    std::lock_guard lock(mu);
    order.push_back(std::move(what));
  };
  Dispatcher& dispatcher = this->dispatcher();
  queue->Async([&, queue] {
    record("first");
    queue->Suspend();
    // Resumed later by work elsewhere, as a completion handler would.
    dispatcher.AsyncGlobal(QualityOfService::kUtility, milliseconds(20), [&, queue] {
      record("resume");
      queue->Resume();
    });
  });
  queue->Async([&] { record("second"); });

  ASSERT_TRUE(this->h_.RunUntil([&] {
    std::lock_guard lock(mu);
    return order.size() == 3;
  }));
  EXPECT_EQ(order, (std::vector<std::string>{"first", "resume", "second"}));
}

TYPED_TEST(DispatchContractTest, IsCurrentOnlyInsideTheQueuesTasks) {
  auto a = this->dispatcher().CreateSerialQueue("a", QualityOfService::kUtility);
  auto b = this->dispatcher().CreateSerialQueue("b", QualityOfService::kUtility);
  std::atomic<int> checks{0};
  std::atomic<bool> ok{true};
  a->Async([&] {
    if (!a->IsCurrent() || b->IsCurrent()) ok = false;
    checks.fetch_add(1);
  });
  this->dispatcher().AsyncGlobal(QualityOfService::kBackground, Duration::zero(), [&] {
    if (a->IsCurrent() || b->IsCurrent()) ok = false;
    checks.fetch_add(1);
  });
  ASSERT_TRUE(this->h_.RunUntil([&] { return checks.load() == 2; }));
  EXPECT_TRUE(ok.load());
  EXPECT_FALSE(a->IsCurrent());
  EXPECT_EQ(a->label(), "a");
}

TYPED_TEST(DispatchContractTest, AsyncAfterRunsInDeadlineOrder) {
  auto queue = this->dispatcher().CreateSerialQueue("later", QualityOfService::kUtility);
  std::mutex mu;
  std::vector<char> order;
  auto record = [&](char c) {
    return [&, c] {
      std::lock_guard lock(mu);
      order.push_back(c);
    };
  };
  queue->AsyncAfter(milliseconds(300), record('c'));
  queue->AsyncAfter(milliseconds(150), record('b'));
  queue->Async(record('a'));
  this->h_.Advance(milliseconds(150));
  this->h_.Advance(milliseconds(150));
  ASSERT_TRUE(this->h_.RunUntil([&] {
    std::lock_guard lock(mu);
    return order.size() == 3;
  }));
  EXPECT_EQ(order, (std::vector<char>{'a', 'b', 'c'}));
}

TYPED_TEST(DispatchContractTest, TasksQueuedWhenTheLastReferenceGoesStillRun) {
  auto queue = this->dispatcher().CreateSerialQueue("orphan", QualityOfService::kUtility);
  std::atomic<int> ran{0};
  for (int i = 0; i < 10; ++i) queue->Async([&] { ran.fetch_add(1); });
  queue.reset();
  EXPECT_TRUE(this->h_.RunUntil([&] { return ran.load() == 10; }));
}

}  // namespace
}  // namespace qn
