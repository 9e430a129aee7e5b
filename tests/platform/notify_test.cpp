#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/linux/linux_dispatch.h"
#include "platform/linux/linux_notify.h"
#include "tests/fakes/FakeNotify.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

constexpr const char* kName = "com.norvel.quenta.reporting";

// What a handler saw: the token it was given and whether it ran on its queue.
struct Deliveries {
  std::mutex mu;
  std::vector<int> tokens;
  bool off_queue = false;
  testing::Counter count;

  std::function<void(int)> Handler(std::shared_ptr<SerialQueue> queue) {
    return [this, queue](int token) {
      {
        std::lock_guard lock(mu);
        tokens.push_back(token);
        off_queue = off_queue || !queue->IsCurrent();
      }
      count.Add();
    };
  }
};

struct LinuxNotifyHarness {
  testing::TempDir dir;
  std::shared_ptr<Notify> notify = NewLinuxNotify({.runtime_dir = dir.path(), .log = nullptr});
};

struct FakeNotifyHarness {
  std::shared_ptr<Notify> notify = std::make_shared<testing::FakeNotify>();
};

template <typename Harness>
class NotifyContractTest : public ::testing::Test {
 protected:
  std::shared_ptr<Dispatcher> dispatcher_ = NewLinuxDispatcher();
  std::shared_ptr<SerialQueue> queue_ =
      dispatcher_->CreateSerialQueue("server", QualityOfService::kUserInteractive);
  Harness h_;

  // Registers `seen` for `name` on `queue` (the server queue when null); returns its token.
  int Register(Deliveries& seen, const char* name = kName,
               std::shared_ptr<SerialQueue> queue = nullptr) {
    if (!queue) queue = queue_;
    int token = 0;
    EXPECT_EQ(h_.notify->Register(name, queue, seen.Handler(queue), &token), 0u);
    return token;
  }
};

using Harnesses = ::testing::Types<LinuxNotifyHarness, FakeNotifyHarness>;
TYPED_TEST_SUITE(NotifyContractTest, Harnesses);

TYPED_TEST(NotifyContractTest, PostRunsTheHandlerOnItsQueueWithItsToken) {
  Deliveries seen;
  Deliveries other;
  const int token = this->Register(seen);
  EXPECT_NE(token, this->Register(other, "other.name"));
  Notify& notify = *this->h_.notify;

  ASSERT_EQ(notify.Post(kName), 0u);
  ASSERT_TRUE(seen.count.WaitFor(1));
  {
    std::lock_guard lock(seen.mu);
    EXPECT_EQ(seen.tokens, std::vector<int>{token});
    EXPECT_FALSE(seen.off_queue);
  }
  // A second post is delivered again; the other name never is.
  ASSERT_EQ(notify.Post(kName), 0u);
  ASSERT_TRUE(seen.count.WaitFor(2));
  EXPECT_EQ(other.count.value(), 0);
}

TYPED_TEST(NotifyContractTest, EveryRegistrationOfTheNameIsWoken) {
  Deliveries a;
  Deliveries b;
  this->Register(a);
  const int token_b = this->Register(
      b, kName, this->dispatcher_->CreateSerialQueue("b", QualityOfService::kUtility));
  ASSERT_EQ(this->h_.notify->Post(kName), 0u);
  ASSERT_TRUE(a.count.WaitFor(1));
  ASSERT_TRUE(b.count.WaitFor(1));
  std::lock_guard lock(b.mu);
  EXPECT_EQ(b.tokens, std::vector<int>{token_b});
  EXPECT_FALSE(b.off_queue);
}

TYPED_TEST(NotifyContractTest, CancelledRegistrationsHearNothing) {
  Deliveries cancelled;
  Deliveries kept;
  const int cancelled_token = this->Register(cancelled);
  this->Register(kept);
  this->h_.notify->Cancel(cancelled_token);
  ASSERT_EQ(this->h_.notify->Post(kName), 0u);
  ASSERT_TRUE(kept.count.WaitFor(1));
  // Both handlers would have been queued on the same serial queue, cancelled one first.
  testing::Counter drained;
  this->queue_->Async([&] { drained.Add(); });
  ASSERT_TRUE(drained.WaitFor(1));
  EXPECT_EQ(cancelled.count.value(), 0);
}

TYPED_TEST(NotifyContractTest, BadRegistrationsAreRefused) {
  Notify& notify = *this->h_.notify;
  int token = -7;
  EXPECT_NE(notify.Register(
                "", this->queue_, [](int) {}, &token),
            0u);
  EXPECT_NE(notify.Register(
                kName, nullptr, [](int) {}, &token),
            0u);
  EXPECT_EQ(token, -7);
}

using LinuxNotifyTest = NotifyContractTest<LinuxNotifyHarness>;

TEST_F(LinuxNotifyTest, PostingTouchesAFileThatOtherProcessesSee) {
  Deliveries seen;
  Register(seen);
  // The command-line tool posts without a Notify object, from its own process.
  const pid_t child = ::fork();
  if (child == 0) ::_exit(PostNotification(h_.dir.path(), kName) == 0 ? 0 : 1);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  ASSERT_TRUE(seen.count.WaitFor(1));
  EXPECT_TRUE(std::filesystem::is_regular_file(h_.dir.File(std::string("notify/") + kName)));
}

TEST(PostNotificationTest, NamesCannotLeaveTheFolder) {
  testing::TempDir dir;
  for (const std::string& name :
       std::vector<std::string>{"", ".", "..", "../x", "a/b", std::string(300, 'n')}) {
    EXPECT_EQ(PostNotification(dir.path(), name), kNotifyStatusInvalidName) << name;
  }
  EXPECT_FALSE(std::filesystem::exists(dir.File("x")));
}

TEST_F(LinuxNotifyTest, AFifoUnderTheNameDoesNotHangThePoster) {
  Deliveries seen;
  Register(seen);
  ASSERT_EQ(::mkfifo((h_.dir.path() + "/notify/fifo").c_str(), 0644), 0);
  EXPECT_EQ(h_.notify->Post("fifo"), kNotifyStatusFailed);
}

}  // namespace
}  // namespace qn
