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

TEST(ClientTest, TypedOperationsDecodeTheirReplies) {
  ListenerHarness harness([](Op op, const Array& args, IpcReply reply) {
    switch (op) {
      case Op::kSendMessage:
        if (args[1] == Value(1)) {
          reply(Value(Dictionary{
              {"domain", "com.norvel.audio.reporting"}, {"code", 1}, {"userInfo", Value()}}));
        } else {
          reply(Value());
        }
        return;
      case Op::kGetServiceNameForReporterID:
        reply(Value(65535));
        return;
      default:
        FakeExportedObject::DefaultReply(op, args, reply);
    }
  });
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  EXPECT_EQ(client->setServiceTypeSync(2, 42), true);
  EXPECT_EQ(client->setConfigurationSync(Value(Dictionary{{"k", "v"}}), 42), true);
  EXPECT_EQ(client->startReportingSessionForIDSync(42), true);
  EXPECT_EQ(client->stopReportingSessionForIDSync(42), true);
  EXPECT_EQ(client->destroyReportingSessionSync(42), true);
  EXPECT_EQ(client->getServiceNameForReporterIDSync(42), 65535);

  auto ok = client->sendMessageSync(Value(Dictionary{{"a", 1}}), 5, 1, std::nullopt);
  ASSERT_TRUE(ok);
  EXPECT_FALSE(ok->has_value());
  auto refused = client->sendMessageSync(Value(Dictionary{}), 1, 1, std::vector<std::int64_t>{});
  ASSERT_TRUE(refused && refused->has_value());
  EXPECT_EQ((*refused)->domain, "com.norvel.audio.reporting");
  EXPECT_EQ((*refused)->code, 1);
  EXPECT_TRUE((*refused)->userInfo.is_null());

  // What went on the wire, argument by argument.
  auto calls = harness.delegate().accepted()[0].object.lock()->calls();
  ASSERT_GE(calls.size(), 8u);
  EXPECT_EQ(calls[0].args, (Array{2, 42}));
  EXPECT_EQ(calls[1].args, (Array{Dictionary{{"k", "v"}}, 42}));
  EXPECT_EQ(calls[6].args, (Array{Dictionary{{"a", 1}}, 5, 1, Value()}));
  EXPECT_EQ(calls[7].args, (Array{Dictionary{}, 1, 1, Array{}}));
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

TEST(ClientTest, ClientDestroyedFromItsOwnCallback) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::promise<void> done;
  Client* raw = client.release();
  raw->createReportingSession(1, [&, raw](bool) {
    delete raw;
    done.set_value();
  });
  ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
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

TEST(ClientTest, ManyThreadsShareOneClient) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::atomic<int> replies{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 250; ++i) {
        const std::int64_t id = t * 1000 + i;
        if (i % 50 == 0) {
          auto d = client->reporterIDValidSync(id);
          if (d && d->Find("reporterID")->as_int64() == id) ++replies;
        } else {
          client->reporterIDValid(id, [&, id](const Dictionary& d) {
            if (d.Find("reporterID")->as_int64() == id) ++replies;
          });
        }
      }
    });
  }
  for (auto& t : threads) t.join();
  ASSERT_TRUE(client->WaitForReplies(std::chrono::seconds(60)));
  EXPECT_EQ(replies, 1000);
}

TEST(ClientTest, FlushWritesQueuedRequestsBeforeClose) {
  std::atomic<int> kills{0};
  ListenerHarness harness([&](Op op, const Array&, IpcReply) {
    if (op == Op::kKillService) ++kills;
  });
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  for (int i = 0; i < 100; ++i) client->killService();  // no replies expected
  EXPECT_EQ(client->outstanding(), 0u);
  EXPECT_TRUE(client->Flush());
  client->Close();
  EXPECT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
  EXPECT_EQ(kills, 100);
}

}  // namespace
}  // namespace qn::testing
