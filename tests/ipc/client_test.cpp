// libqnreporting against an in-process listener with a fake exported object.

#include <gtest/gtest.h>

#include <future>

#include "qnreporting/Client.h"
#include "tests/ipc/ipc_test_util.h"

namespace qn::testing {
namespace {

using client::Client;
using protocol::Op;

std::unique_ptr<Client> Connect(const std::string& path) {
  std::string error;
  auto client = Client::Connect(path, &error);
  EXPECT_NE(client, nullptr) << error;
  return client;
}

TEST(ClientTest, ConnectToAMissingSocketFailsWithAReason) {
  TempDir dir;
  std::string error;
  auto client = Client::Connect(dir.path() + "/nothing.sock", &error);
  EXPECT_EQ(client, nullptr);
  EXPECT_NE(error.find(dir.path() + "/nothing.sock"), std::string::npos) << error;
}

TEST(ClientTest, WrongResultTypeEndsTheConnectionWithALocalError) {
  ListenerHarness harness([](Op, const Array&, IpcReply reply) { reply(Value("yes")); });
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::promise<client::ConnectionError> error;
  client->SetConnectionErrorHandler([&](const client::ConnectionError& e) { error.set_value(e); });
  bool called = false;
  client->createReportingSession(1, [&](bool) { called = true; });
  EXPECT_TRUE(client->WaitUntilEnded());
  auto e = error.get_future().get();
  EXPECT_EQ(e.domain, client::kClientErrorDomain);
  EXPECT_EQ(e.code, static_cast<std::int64_t>(client::ClientErrorCode::kBadReply));
  EXPECT_FALSE(called);
}

TEST(ClientTest, PendingCallbacksAreDroppedWhenTheConnectionEnds) {
  ListenerHarness harness([](Op, const Array&, IpcReply) {});  // never replies
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::atomic<int> invalidations{0};
  client->SetInvalidationHandler([&] { ++invalidations; });
  auto token = std::make_shared<int>(0);
  std::weak_ptr<int> watch = token;
  client->createReportingSession(1, [token](bool) { ADD_FAILURE() << "no reply was sent"; });
  token.reset();
  EXPECT_EQ(client->outstanding(), 1u);
  EXPECT_FALSE(client->WaitForReplies(std::chrono::milliseconds(50)));
  harness.Stop();
  EXPECT_TRUE(client->WaitUntilEnded());
  EXPECT_EQ(invalidations, 1);
  EXPECT_TRUE(watch.expired()) << "the callback was released";
  EXPECT_FALSE(client->WaitForReplies()) << "the reply can no longer come";
  EXPECT_EQ(client->createReportingSessionSync(2), std::nullopt);
  client->Close();
  EXPECT_EQ(invalidations, 1);
}

TEST(ClientTest, BlockingCallFromACallbackReturnsInsteadOfDeadlocking) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::promise<std::optional<bool>> inner;
  client->createReportingSession(1, [&](bool) {
    inner.set_value(client->createReportingSessionSync(2, std::chrono::seconds(30)));
  });
  auto future = inner.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_EQ(future.get(), std::nullopt);
}

TEST(ClientTest, RequestTooLargeForAFrameIsNotSent) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  Value huge(Dictionary{{"blob", std::string(protocol::kMaxBodyBytes, 'x')}});
  EXPECT_EQ(client->sendMessage(huge, 1, 1, std::nullopt, nullptr), 0u);
  EXPECT_EQ(client->outstanding(), 0u);
  EXPECT_EQ(client->createReportingSessionSync(1), true);
}

}  // namespace
}  // namespace qn::testing
