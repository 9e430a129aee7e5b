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

// A post runs every live registration of its name on that registration's queue with its
// own token, again for every post; other names and cancelled registrations hear nothing.
TYPED_TEST(NotifyContractTest, PostRunsEveryLiveHandlerOfTheNameOnItsQueueWithItsToken) {
  Deliveries seen, other_queue, other_name, cancelled;
  const int token = this->Register(seen);
  const int cancelled_token = this->Register(cancelled);  // before `seen` on the same queue
  const int other_token = this->Register(
      other_queue, kName, this->dispatcher_->CreateSerialQueue("b", QualityOfService::kUtility));
  EXPECT_NE(token, this->Register(other_name, "other.name"));
  this->h_.notify->Cancel(cancelled_token);

  for (int post = 1; post <= 2; ++post) {
    ASSERT_EQ(this->h_.notify->Post(kName), 0u);
    ASSERT_TRUE(seen.count.WaitFor(post));
    ASSERT_TRUE(other_queue.count.WaitFor(post));
  }
  testing::Counter drained;  // whatever was queued on the server queue has run
  this->queue_->Async([&] { drained.Add(); });
  ASSERT_TRUE(drained.WaitFor(1));
  EXPECT_EQ(other_name.count.value() + cancelled.count.value(), 0);
  for (auto [d, t] : {std::pair{&seen, token}, std::pair{&other_queue, other_token}}) {
    std::lock_guard lock(d->mu);
    EXPECT_EQ(d->tokens, (std::vector<int>{t, t}));
    EXPECT_FALSE(d->off_queue);
  }
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
  EXPECT_TRUE(std::filesystem::is_regular_file(h_.dir.File("notify/com.norvel.quenta.reporting")));
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
