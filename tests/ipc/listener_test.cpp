// The Linux IPC layer, driven through the real client library and through raw sockets.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "qnreporting/Client.h"
#include "tests/ipc/ipc_test_util.h"

namespace qn::testing {
namespace {

using client::Client;
using protocol::ConnectionError;
using protocol::Op;

LinuxIpcOptions Options(const std::string& path) {
  LinuxIpcOptions options;
  options.socket_path = path;
  options.socket_activation = false;
  options.notify_ready = false;
  return options;
}

std::unique_ptr<Client> Connect(const std::string& path) {
  std::string error;
  auto client = Client::Connect(path, &error);
  EXPECT_NE(client, nullptr) << error;
  return client;
}

// The connection error a raw socket received before the service closed it.
std::optional<std::int64_t> ErrorCode(const std::vector<Value>& frames) {
  if (frames.empty()) return std::nullopt;
  const Array* reply = frames.back().as_array();
  if (!reply || reply->size() != 2 || (*reply)[0].as_int64() != 0) return std::nullopt;
  const Dictionary* error = (*reply)[1].as_dictionary();
  if (!error) return std::nullopt;
  const Value* domain = error->Find("domain");
  if (!domain || !domain->as_string() || *domain->as_string() != protocol::kIpcErrorDomain) {
    return std::nullopt;
  }
  const Value* code = error->Find("code");
  return code ? code->as_int64() : std::nullopt;
}

TEST(LinuxIpcTest, RequestReachesTheExportedObjectAndTheReplyComesBack) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);

  EXPECT_EQ(client->createReportingSessionSync(42), true);
  auto valid = client->reporterIDValidSync(-9);
  ASSERT_TRUE(valid);
  EXPECT_EQ(*valid, (Dictionary{{"reporterID", -9}, {"serviceType", 7}}));
  EXPECT_EQ(client->getAllReportersSync(), (std::vector<std::int64_t>{1, 2, 3}));

  auto accepted = harness.delegate().accepted();
  ASSERT_EQ(accepted.size(), 1u);
  auto object = accepted[0].object.lock();
  ASSERT_TRUE(object);
  auto calls = object->calls();
  ASSERT_EQ(calls.size(), 3u);
  EXPECT_EQ(calls[0].op, Op::kCreateReportingSession);
  EXPECT_EQ(calls[0].args, (Array{42}));
  EXPECT_EQ(calls[1].op, Op::kReporterIDValid);
  EXPECT_EQ(calls[2].op, Op::kGetAllReporters);
  EXPECT_TRUE(calls[2].args.empty());
}

TEST(LinuxIpcTest, ConnectionKnowsItsPeer) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  ASSERT_TRUE(Eventually([&] { return harness.delegate().accepted().size() == 1; }));
  auto connection = harness.delegate().accepted()[0].connection;
  EXPECT_EQ(connection->PeerPid(), ::getpid());
  EXPECT_EQ(connection->PeerUid(), ::getuid());
  const std::string prefix = "<connection pid=" + std::to_string(::getpid()) +
                             " uid=" + std::to_string(::getuid()) + " fd=";
  EXPECT_EQ(connection->Description().rfind(prefix, 0), 0u) << connection->Description();
}

TEST(LinuxIpcTest, SocketFileHasMode0660AndGoesAwayWhenStopped) {
  auto harness = std::make_unique<ListenerHarness>();
  const std::string path = harness->socket_path();
  struct stat info;
  ASSERT_EQ(::lstat(path.c_str(), &info), 0);
  EXPECT_TRUE(S_ISSOCK(info.st_mode));
  EXPECT_EQ(info.st_mode & 0777, 0660u);
  harness->Stop();
  EXPECT_NE(::lstat(path.c_str(), &info), 0);
}

TEST(LinuxIpcTest, RepliesMadeOnOtherThreadsKeepTheirOrder) {
  // Each reply is made on a thread of its own after a delay that shrinks with the request
  // number, yet replies of one connection must leave in the order they were made: the
  // test records that order and compares it with the order of arrival.
  std::mutex mu;
  std::vector<std::int64_t> made;
  std::vector<std::thread> threads;
  ListenerHarness harness([&](Op, const Array& args, IpcReply reply) {
    std::lock_guard lock(mu);
    threads.emplace_back([&, id = args[0], reply = std::move(reply)] {
      std::this_thread::sleep_for(std::chrono::milliseconds(20 - id.as_int64().value() % 20));
      std::lock_guard inner(mu);
      made.push_back(id.as_int64().value());
      reply(Value(Dictionary{{"reporterID", id}, {"serviceType", 1}}));
    });
  });
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::vector<std::int64_t> arrived;
  for (int id = 0; id < 40; ++id) {
    client->reporterIDValid(id, [&](const Dictionary& d) {
      arrived.push_back(d.Find("reporterID")->as_int64().value());
    });
  }
  ASSERT_TRUE(client->WaitForReplies());
  {
    std::lock_guard lock(mu);
    for (auto& t : threads) t.join();
    EXPECT_EQ(arrived, made);
  }
  EXPECT_EQ(arrived.size(), 40u);
}

TEST(LinuxIpcTest, TenThousandPipelinedRequestsAllAnsweredInOrder) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  constexpr int kRequests = 10000;
  std::vector<std::int64_t> arrived;
  arrived.reserve(kRequests);
  for (int i = 0; i < kRequests; ++i) {
    ASSERT_NE(client->reporterIDValid(i,
                                      [&](const Dictionary& d) {
                                        arrived.push_back(d.Find("reporterID")->as_int64().value());
                                      }),
              0u);
  }
  ASSERT_TRUE(client->WaitForReplies(std::chrono::seconds(120)));
  ASSERT_EQ(arrived.size(), static_cast<std::size_t>(kRequests));
  for (int i = 0; i < kRequests; ++i) ASSERT_EQ(arrived[i], i);
}

TEST(LinuxIpcTest, ReplyMadeTwiceArrivesTwice) {
  // getServiceNameForReporterID with ID 0 replies twice by design; any other reply made
  // twice reaches the client too, as an unexpected reply once its callback is done.
  ListenerHarness harness([](Op op, const Array& args, IpcReply reply) {
    if (op == Op::kGetServiceNameForReporterID) {
      reply(Value(65535));
      reply(Value(args[0].as_int64().value() == 0 ? 3 : 4));
      return;
    }
    reply(Value(true));
    reply(Value(false));
  });
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::mutex mu;
  std::vector<std::uint16_t> types;
  std::vector<std::pair<std::uint32_t, Value>> unexpected;
  client->SetUnexpectedReplyHandler([&](std::uint32_t id, const Value& result) {
    std::lock_guard lock(mu);
    unexpected.emplace_back(id, result);
  });
  client->getServiceNameForReporterID(0, [&](std::uint16_t type) {
    std::lock_guard lock(mu);
    types.push_back(type);
  });
  const std::uint32_t create = client->createReportingSession(5, nullptr);
  EXPECT_EQ(client->getServiceNameForReporterIDSync(0), 3);
  ASSERT_TRUE(client->WaitForReplies());
  std::lock_guard lock(mu);
  EXPECT_EQ(types, (std::vector<std::uint16_t>{65535, 3}));
  ASSERT_EQ(unexpected.size(), 1u);
  EXPECT_EQ(unexpected[0].first, create);
  EXPECT_EQ(unexpected[0].second, Value(false));
}

TEST(LinuxIpcTest, LateReplyFindsItsCallback) {
  // A start reply held back until a later request, as a started session holds it.
  std::mutex mu;
  IpcReply held;
  ListenerHarness harness([&](Op op, const Array&, IpcReply reply) {
    std::lock_guard lock(mu);
    if (op == Op::kStartReportingSession) {
      held = std::move(reply);
    } else {
      if (op == Op::kStopReportingSession && held) held(Value(true));
      reply(Value(true));
    }
  });
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::atomic<int> started{0};
  client->startReportingSessionForID(1, [&](bool ok) { started += ok ? 1 : 100; });
  EXPECT_EQ(client->createReportingSessionSync(2), true);
  EXPECT_EQ(client->outstanding(), 1u);
  EXPECT_EQ(client->stopReportingSessionForIDSync(1), true);
  ASSERT_TRUE(client->WaitForReplies());
  EXPECT_EQ(started, 1);
}

TEST(LinuxIpcTest, InvalidationRunsOnceAndReleasesTheExportedObject) {
  ListenerHarness harness;
  {
    auto client = Connect(harness.socket_path());
    ASSERT_TRUE(client);
    EXPECT_EQ(client->createReportingSessionSync(1), true);
  }  // closes
  ASSERT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
  auto accepted = harness.delegate().accepted();
  ASSERT_EQ(accepted.size(), 1u);
  EXPECT_TRUE(accepted[0].object.expired());
  // Nothing that happens later invalidates it again.
  harness.Stop();
  EXPECT_EQ(*accepted[0].invalidations, 1);
}

TEST(LinuxIpcTest, StopInvalidatesEveryOpenConnectionOnceAndResumeReturns) {
  ListenerHarness harness;
  auto a = Connect(harness.socket_path());
  auto b = Connect(harness.socket_path());
  ASSERT_TRUE(a && b);
  std::atomic<int> ended{0};
  a->SetInvalidationHandler([&] { ++ended; });
  b->SetInvalidationHandler([&] { ++ended; });
  EXPECT_EQ(a->createReportingSessionSync(1), true);
  EXPECT_EQ(b->createReportingSessionSync(1), true);
  harness.Stop();  // returns only once Resume has returned
  for (const auto& entry : harness.delegate().accepted()) EXPECT_EQ(*entry.invalidations, 1);
  EXPECT_TRUE(a->WaitUntilEnded());
  EXPECT_TRUE(b->WaitUntilEnded());
  EXPECT_EQ(ended, 2);
  EXPECT_EQ(a->createReportingSession(2, nullptr), 0u);
}

TEST(LinuxIpcTest, RefusedConnectionIsClosed) {
  ListenerHarness harness;
  harness.delegate().accept = false;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  EXPECT_TRUE(client->WaitUntilEnded());
  EXPECT_FALSE(client->connected());
}

TEST(LinuxIpcTest, ReplyAfterTheConnectionEndedIsDropped) {
  std::mutex mu;
  IpcReply held;
  ListenerHarness harness([&](Op, const Array&, IpcReply reply) {
    std::lock_guard lock(mu);
    held = std::move(reply);
  });
  {
    auto client = Connect(harness.socket_path());
    ASSERT_TRUE(client);
    client->createReportingSession(1, nullptr);
    ASSERT_TRUE(Eventually([&] {
      std::lock_guard lock(mu);
      return static_cast<bool>(held);
    }));
  }
  ASSERT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
  std::lock_guard lock(mu);
  held(Value(true));  // must do nothing, from any thread, also after Stop
  harness.Stop();
  held(Value(true));
}

// Bad input: each case gets the error frame (or, when the peer is gone, a clean close),
// an error line in the log, and only its own connection closes.
struct BadInput {
  const char* name;
  std::string bytes;
  std::optional<ConnectionError> code;  // nullopt: only a close is required
  bool close_write = false;             // the client ends its side after sending
};

// The case's name is in the test's name already; its bytes would make CTest's lines
// hundreds of characters wide.
void PrintTo(const BadInput&, std::ostream*) {}

class LinuxIpcBadInputTest : public ::testing::TestWithParam<BadInput> {};

std::string Nested(int depth) {
  std::string body(static_cast<std::size_t>(depth), '\x91');  // fixarray of one element
  body.push_back('\xc0');
  return body;
}

TEST_P(LinuxIpcBadInputTest, ClosesOnlyThatConnection) {
  const BadInput& input = GetParam();
  ListenerHarness harness;
  auto bystander = Connect(harness.socket_path());
  ASSERT_TRUE(bystander);
  std::atomic<int> bystander_ended{0};
  bystander->SetInvalidationHandler([&] { ++bystander_ended; });
  ASSERT_EQ(bystander->createReportingSessionSync(1), true);

  RawSocket raw(harness.socket_path());
  ASSERT_TRUE(raw.connected());
  raw.Send(input.bytes);
  if (input.close_write) raw.ShutdownWrite();
  bool clean_end = false;
  auto frames = raw.ReadUntilEnd(&clean_end);
  if (input.code) {
    EXPECT_EQ(ErrorCode(frames), static_cast<std::int64_t>(*input.code)) << input.name;
  }
  EXPECT_TRUE(clean_end || !frames.empty()) << "the connection must end";
  EXPECT_TRUE(Eventually([&] { return harness.log().Contains("bad input"); }));
  for (const auto& line : harness.log().Lines()) {
    if (line.text.find("bad input") != std::string::npos) {
      EXPECT_EQ(line.level, LogLevel::kError);
      EXPECT_EQ(line.text.rfind("linux_ipc.cpp:", 0), 0u) << line.text;
    }
  }

  EXPECT_EQ(bystander->reporterIDValidSync(8), (Dictionary{{"reporterID", 8}, {"serviceType", 7}}));
  EXPECT_EQ(bystander_ended, 0);
  EXPECT_TRUE(bystander->connected());
  // Exactly one connection (the bad one) was invalidated.
  EXPECT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
}

const std::string kTinyLength = std::string("\x00\x00\x00\x01", 4);

INSTANTIATE_TEST_SUITE_P(
    Cases, LinuxIpcBadInputTest,
    ::testing::Values(
        BadInput{"garbage", "hello, is this the reporting service?", ConnectionError::kBadLength},
        BadInput{"zero length", std::string(4, '\0'), ConnectionError::kBadLength},
        BadInput{"header over 1 MiB", std::string("\x00\x10\x00\x01", 4) + "xx",
                 ConnectionError::kBadLength},
        BadInput{"reserved byte", kTinyLength + "\xc1", ConnectionError::kBadMessagePack},
        BadInput{"two values in one body", RawFrame(std::string("\x92\x01\x01\x01", 4)),
                 ConnectionError::kBadMessagePack},
        BadInput{"1000-deep nesting", RawFrame(Nested(1000)), ConnectionError::kTooDeep},
        BadInput{"not an array", EncodedFrame(Value(Dictionary{{"op", 1}})),
                 ConnectionError::kBadRequest},
        BadInput{"request id 0", EncodedFrame(Value(Array{1, 0, 5})), ConnectionError::kBadRequest},
        BadInput{"unknown op", EncodedFrame(Value(Array{12, 1})), ConnectionError::kUnknownOp},
        BadInput{"op 0", EncodedFrame(Value(Array{0, 1})), ConnectionError::kUnknownOp},
        BadInput{"string reporter ID", EncodedFrame(Value(Array{1, 1, "42"})),
                 ConnectionError::kBadArguments},
        BadInput{"service type over 16 bits", EncodedFrame(Value(Array{2, 1, 70000, 5})),
                 ConnectionError::kBadArguments},
        BadInput{"missing argument", EncodedFrame(Value(Array{4, 1, Dictionary{}})),
                 ConnectionError::kBadArguments},
        BadInput{"extra argument", EncodedFrame(Value(Array{10, 1, 5})),
                 ConnectionError::kBadArguments},
        BadInput{"string in the ID list",
                 EncodedFrame(Value(Array{6, 1, Dictionary{}, 1, 1, Array{1, "x"}})),
                 ConnectionError::kBadArguments},
        BadInput{"good request, then garbage",
                 EncodedFrame(Value(Array{1, 1, 5})) + kTinyLength + "\xc1",
                 ConnectionError::kBadMessagePack},
        BadInput{"truncated frame, then end of stream",
                 std::string("\x00\x00\x00\x0a", 4) + "\x93\x01", std::nullopt, true}),
    [](const ::testing::TestParamInfo<BadInput>& info) {
      std::string name;
      for (char c : std::string(info.param.name)) {
        name.push_back(std::isalnum(static_cast<unsigned char>(c)) ? c : '_');
      }
      return name;
    });

TEST(LinuxIpcTest, GoodRequestBeforeBadInputIsStillAnswered) {
  ListenerHarness harness;
  RawSocket raw(harness.socket_path());
  ASSERT_TRUE(raw.connected());
  raw.Send(EncodedFrame(Value(Array{1, 7, 5})) + EncodedFrame(Value(Array{99, 8})));
  auto frames = raw.ReadUntilEnd();
  ASSERT_EQ(frames.size(), 2u);
  EXPECT_EQ(frames[0], Value(Array{7, true}));
  EXPECT_EQ(ErrorCode(frames), static_cast<std::int64_t>(ConnectionError::kUnknownOp));
}

TEST(LinuxIpcTest, ClientLibraryReportsTheConnectionErrorFrame) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::mutex mu;
  std::vector<client::ConnectionError> errors;
  client->SetConnectionErrorHandler([&](const client::ConnectionError& error) {
    std::lock_guard lock(mu);
    errors.push_back(error);
  });
  client->SendRequest(static_cast<Op>(40), {}, nullptr);
  EXPECT_TRUE(client->WaitUntilEnded());
  std::lock_guard lock(mu);
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_EQ(errors[0].domain, protocol::kIpcErrorDomain);
  EXPECT_EQ(errors[0].code, static_cast<std::int64_t>(ConnectionError::kUnknownOp));
  EXPECT_NE(errors[0].message.find("40"), std::string::npos) << errors[0].message;
}

TEST(LinuxIpcTest, PeerThatNeverReadsIsClosedPastTheCap) {
  // Each reply carries 256 KiB; the raw client asks for many and never reads.
  const std::string big(256 * 1024, 'x');
  ListenerHarness harness([&](Op op, const Array& args, IpcReply reply) {
    if (op == Op::kReporterIDValid && args[0] == Value(-1)) {
      reply(Value(Dictionary{{"reporterID", -1}, {"serviceType", 0}, {"padding", big}}));
    } else {
      FakeExportedObject::DefaultReply(op, args, reply);
    }
  });
  auto bystander = Connect(harness.socket_path());
  ASSERT_TRUE(bystander);

  RawSocket raw(harness.socket_path());
  ASSERT_TRUE(raw.connected());
  std::string requests;
  for (std::uint32_t id = 1; id <= 64; ++id) {  // 16 MiB of replies
    requests += EncodedFrame(Value(Array{9, id, -1}));
  }
  raw.Send(requests);
  ASSERT_TRUE(Eventually([&] { return harness.log().Contains("does not read its replies"); }));
  EXPECT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));

  EXPECT_EQ(bystander->createReportingSessionSync(3), true);
  EXPECT_TRUE(bystander->connected());
  // What the slow peer finally reads is whole frames, then the end.
  bool clean_end = false;
  auto frames = raw.ReadUntilEnd(&clean_end);
  EXPECT_LT(frames.size(), 64u);
}

TEST(LinuxIpcTest, AcceptRecoversWhenDescriptorsRunOut) {
#if defined(__SANITIZE_ADDRESS__)
  // UBSan's vptr check probes memory through a pipe of its own; with every descriptor in
  // use it cannot, and reports a false error. The normal and TSan builds run this test.
  GTEST_SKIP() << "needs free descriptors for the sanitizer runtime";
#endif
  ListenerHarness harness;
  // Sockets made while descriptors are available, connected once they have run out: the
  // listener's accept then fails with EMFILE until the limit is raised again.
  std::vector<std::unique_ptr<RawSocket>> sockets;
  for (int i = 0; i < 3; ++i) sockets.push_back(std::make_unique<RawSocket>(""));
  rlimit old_limit;
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &old_limit), 0);
  const int lowest_free = ::dup(0);
  ASSERT_GE(lowest_free, 0);
  ::close(lowest_free);
  rlimit tight = old_limit;
  tight.rlim_cur = static_cast<rlim_t>(lowest_free);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  for (auto& socket : sockets) EXPECT_TRUE(socket->Connect(harness.socket_path()));
  const bool logged = Eventually([&] { return harness.log().Contains("accept failed"); });
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &old_limit), 0);
  ASSERT_TRUE(logged);

  // Every waiting connection is accepted and served once descriptors are back.
  for (std::uint32_t i = 0; i < sockets.size(); ++i) {
    sockets[i]->Send(EncodedFrame(Value(Array{1, i + 1, 5})));
    sockets[i]->ShutdownWrite();
    auto frames = sockets[i]->ReadUntilEnd();
    ASSERT_EQ(frames.size(), 1u);
    EXPECT_EQ(frames[0], Value(Array{i + 1, true}));
  }
  EXPECT_EQ(harness.log().Count("accept failed"), 1) << "one line per run of failures";
}

TEST(LinuxIpcListenerSetupTest, StaleSocketFileIsReplaced) {
  TempDir dir;
  const std::string path = dir.path() + "/reporting.sock";
  // A socket file whose listener is gone (closed without unlinking).
  const int stale = BindUnixSocket(SOCK_STREAM, path);
  ASSERT_GE(stale, 0);
  ::close(stale);
  auto log = std::make_shared<LogCapture>();
  auto made = NewLinuxIpcListener(Options(path), log);
  ASSERT_TRUE(made.listener) << made.error;
  made.listener->SetDelegate(std::make_shared<FakeDelegate>());
  std::thread thread([&] { made.listener->Resume(); });
  auto client = Connect(path);
  EXPECT_TRUE(client && client->createReportingSessionSync(1) == true);
  made.listener->Stop();
  thread.join();
}

TEST(LinuxIpcListenerSetupTest, LiveListenerIsNotReplaced) {
  TempDir dir;
  const std::string path = dir.path() + "/reporting.sock";
  // Something else (no lock file of ours) listens on the path.
  const int fd = BindUnixSocket(SOCK_STREAM, path);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(::listen(fd, 4), 0);

  auto made = NewLinuxIpcListener(Options(path), std::make_shared<LogCapture>());
  EXPECT_FALSE(made.listener);
  EXPECT_NE(made.error.find("already listening on " + path), std::string::npos) << made.error;
  struct stat info;
  EXPECT_EQ(::lstat(path.c_str(), &info), 0) << "the live socket must stay";
  ::close(fd);
}

TEST(LinuxIpcListenerSetupTest, SecondDaemonOnTheSamePathIsRefused) {
  ListenerHarness first;
  auto second = NewLinuxIpcListener(Options(first.socket_path()), std::make_shared<LogCapture>());
  EXPECT_FALSE(second.listener);
  EXPECT_NE(second.error.find("already"), std::string::npos) << second.error;
  // The first one still serves.
  auto client = Connect(first.socket_path());
  EXPECT_TRUE(client && client->createReportingSessionSync(1) == true);
}

TEST(LinuxIpcListenerSetupTest, PathThatIsNotASocketIsRefusedAndKept) {
  TempDir dir;
  const std::string path = dir.path() + "/reporting.sock";
  int fd = ::open(path.c_str(), O_CREAT | O_WRONLY, 0600);
  ASSERT_GE(fd, 0);
  ::close(fd);
  auto made = NewLinuxIpcListener(Options(path), std::make_shared<LogCapture>());
  EXPECT_FALSE(made.listener);
  EXPECT_NE(made.error.find("not a socket"), std::string::npos) << made.error;
  struct stat info;
  ASSERT_EQ(::lstat(path.c_str(), &info), 0);
  EXPECT_TRUE(S_ISREG(info.st_mode));
}

TEST(LinuxIpcListenerSetupTest, MissingFoldersAreCreated) {
  TempDir dir;
  const std::string path = dir.path() + "/a/b/reporting.sock";
  auto made = NewLinuxIpcListener(Options(path), std::make_shared<LogCapture>());
  ASSERT_TRUE(made.listener) << made.error;
  struct stat info;
  ASSERT_EQ(::stat((dir.path() + "/a/b").c_str(), &info), 0);
  EXPECT_TRUE(S_ISDIR(info.st_mode));
}

TEST(LinuxIpcListenerSetupTest, StopBeforeResumeMakesResumeReturn) {
  TempDir dir;
  auto made = NewLinuxIpcListener(Options(dir.path() + "/s.sock"), std::make_shared<LogCapture>());
  ASSERT_TRUE(made.listener) << made.error;
  made.listener->Stop();
  made.listener->Resume();  // returns at once
}

}  // namespace
}  // namespace qn::testing
