// The Linux IPC layer driven through the real client library (C++ and C) and raw sockets,
// and the daemon's folders.
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <future>

#include "common/Paths.h"
#include "qnreporting/qnreporting.h"
#include "tests/fakes/RawConnection.h"
#include "tests/ipc/ipc_test_util.h"

extern "C" int qn_c_api_round_trip(const char* socket_path);

namespace qn::testing {
namespace {

using client::Client;
using protocol::ConnectionError;
using protocol::Op;

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

// A connection that ends is invalidated once and its exported object released; Stop
// invalidates every open one once, and Resume returns.
TEST(LinuxIpcTest, EachConnectionIsInvalidatedOnceWhenItEndsOrTheListenerStops) {
  ListenerHarness harness;
  auto first = Connect(harness.socket_path());
  ASSERT_TRUE(first && first->createReportingSessionSync(1) == true);
  first.reset();
  ASSERT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
  EXPECT_TRUE(harness.delegate().accepted().at(0).object.expired());
  auto a = Connect(harness.socket_path());
  auto b = Connect(harness.socket_path());
  ASSERT_TRUE(a && b);
  std::atomic<int> ended{0};
  for (auto* c : {a.get(), b.get()}) {
    c->SetInvalidationHandler([&] { ++ended; });
    EXPECT_EQ(c->createReportingSessionSync(1), true);
  }
  harness.Stop();  // returns only once Resume has returned
  for (const auto& entry : harness.delegate().accepted()) EXPECT_EQ(*entry.invalidations, 1);
  EXPECT_TRUE(a->WaitUntilEnded() && b->WaitUntilEnded());
  EXPECT_EQ(ended, 2);
  EXPECT_EQ(a->createReportingSession(2, nullptr), 0u);
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
  std::vector<std::unique_ptr<RawConnection>> sockets;
  for (int i = 0; i < 3; ++i) sockets.push_back(std::make_unique<RawConnection>(""));
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
    ASSERT_TRUE(sockets[i]->Write(RawConnection::Frame(Value(Array{1, i + 1, 5}))));
    EXPECT_EQ(sockets[i]->ReadFrame(), Value(Array{i + 1, true}));
  }
  EXPECT_EQ(harness.log().Count("accept failed"), 1) << "one line per run of failures";
}

// The requests [9, first..last, reporter] as one write.
std::string ValidRequests(std::uint32_t first, std::uint32_t last) {
  std::string bytes;
  for (std::uint32_t id = first; id <= last; ++id) {
    bytes += RawConnection::Frame(Value(Array{9, id, 5}));
  }
  return bytes;
}

// At most max_pending_requests requests of a connection wait to be taken in; the rest wait
// in the socket and follow, in order and all of them, once those are taken in.
TEST(LinuxIpcTest, AConnectionIsReadOnlyWhileFewRequestsWaitToBeTakenIn) {
  LinuxIpcOptions options;
  options.max_pending_requests = 10;
  options.counters = std::make_shared<Counters>();
  ListenerHarness harness(nullptr, options);
  RawConnection raw(harness.socket_path());
  ASSERT_TRUE(raw.Write(ValidRequests(1, 1)));
  ASSERT_TRUE(raw.ReadFrame());
  auto object = harness.delegate().accepted().at(0).object.lock();
  object->HoldTakenIn(true);
  ASSERT_TRUE(raw.Write(ValidRequests(2, 101)));
  ASSERT_TRUE(Eventually([&] { return object->requests == 11; }));
  std::this_thread::sleep_for(std::chrono::milliseconds(100));  // time to (wrongly) read on
  EXPECT_EQ(object->requests, 11);
  EXPECT_EQ(Counters::Get(options.counters->pausedForRequests), 1u);
  object->HoldTakenIn(false);
  for (std::uint32_t id = 2; id <= 101; ++id) {
    const auto reply = raw.ReadFrame();
    ASSERT_TRUE(reply && reply->as_array()->front() == Value(id));
  }
  EXPECT_EQ(object->requests, 101);
}

// While the store is behind, or the service holds too many of the uid's message bytes
// (waiting for the store, or parked), connections that have sent messages are not read;
// others are, and each hold counts under its reason.
TEST(LinuxIpcTest, MessageSendersWaitWhileTheStoreIsBehind) {
  enum Cause { kStoreBehind, kUidStoreBytes, kUidParkedBytes };
  for (const Cause cause : {kStoreBehind, kUidStoreBytes, kUidParkedBytes}) {
    SCOPED_TRACE(cause);
    std::atomic<bool> behind{false};
    LinuxIpcOptions options;
    options.message_intake_blocked = [&] { return behind.load(); };
    options.max_store_bytes_per_uid = options.max_parked_bytes_per_uid = 1000;
    options.counters = std::make_shared<Counters>();
    ListenerHarness harness(nullptr, options);
    RawConnection sender(harness.socket_path());
    const std::string message =
        RawConnection::Frame(Value(Array{6, 1, Dictionary{}, 1, 1, Value()}));
    ASSERT_TRUE(sender.Write(message));
    ASSERT_EQ(sender.ReadFrame(), Value(Array{1, Value()}));
    HeldBytes& held = *harness.delegate().accepted().at(0).held;
    const auto kind = cause == kUidParkedBytes ? HeldBytes::kParked : HeldBytes::kStore;
    const auto hold = [&](std::int64_t bytes) {
      cause == kStoreBehind ? behind.store(bytes > 0) : held.Add(kind, bytes);
    };
    hold(1000);
    ASSERT_TRUE(sender.Write(ValidRequests(2, 3)));
    RawConnection other(harness.socket_path());
    ASSERT_TRUE(other.Write(ValidRequests(7, 7)));
    EXPECT_TRUE(other.ReadFrame());
    EXPECT_FALSE(sender.ReadFrame(std::chrono::milliseconds(100)));
    hold(-1000);
    EXPECT_TRUE(sender.ReadFrame());
    EXPECT_TRUE(sender.ReadFrame());
    EXPECT_EQ(Counters::Get(cause == kStoreBehind ? options.counters->pausedForStore
                                                  : options.counters->pausedForHeld[kind]),
              1u);
  }
}

// Room for a reply counts in the reply budget from the moment its request is handed over:
// requests whose replies could be large are not all handed over at once, and those held
// back follow once the replies are made.
TEST(LinuxIpcTest, RepliesNotYetMadeCountInTheReplyBudget) {
  std::mutex mu;
  std::vector<IpcReply> unanswered;
  ListenerHarness harness(
      [&](Op, const Array&, IpcReply reply) {
        std::lock_guard lock(mu);
        unanswered.push_back(std::move(reply));
      },
      [] {
        LinuxIpcOptions options;
        options.budgets[kIpcReplyBytes].per_uid = 2 * protocol::ReplyRoomOf(Op::kGetAllReporters);
        return options;
      }());
  RawConnection raw(harness.socket_path());
  std::string requests;
  for (std::uint32_t id = 1; id <= 10; ++id) requests += RawConnection::Frame(Value(Array{10, id}));
  ASSERT_TRUE(raw.Write(requests));
  ASSERT_TRUE(Eventually([&] { return !harness.delegate().accepted().empty(); }));
  auto object = harness.delegate().accepted().at(0).object.lock();
  ASSERT_TRUE(Eventually([&] { return object->requests == 2; }));
  std::this_thread::sleep_for(std::chrono::milliseconds(100));  // time to (wrongly) read on
  EXPECT_EQ(object->requests, 2);
  for (std::uint32_t id = 1; id <= 10; ++id) {
    ASSERT_TRUE(Eventually([&] {
      std::lock_guard lock(mu);
      for (auto& reply : unanswered) reply(Value(Array{1}));
      unanswered.clear();
      return object->requests == 10;
    }));
    const auto reply = raw.ReadFrame();
    ASSERT_TRUE(reply && reply->as_array()->front() == Value(id));
  }
}

// Half-read frames cannot hold the frame budget for ever: a frame is read to its end once
// its whole length fits the budget, others wait their turn (not timed out meanwhile), and a
// peer that stalls inside an admitted frame is timed out.
TEST(LinuxIpcTest, FramesInProgressFinishWithinTheFrameBudget) {
  LinuxIpcOptions options;
  options.budgets[kIpcFrameBytes].per_uid = 3 * protocol::kMaxBodyBytes / 2;
  options.partial_frame_timeout_ms = 1000;
  ListenerHarness harness(nullptr, options);
  const auto request = [](std::uint32_t id) {
    return RawConnection::Frame(
        Value(Array{4, id, Dictionary{{"k", std::string(1'000'000, 'x')}}, 1}));
  };
  RawConnection stalled(harness.socket_path());
  ASSERT_TRUE(stalled.Write(request(1).substr(0, 100'000)));
  ASSERT_TRUE(Eventually([&] { return harness.delegate().accepted().size() == 1; }));
  std::this_thread::sleep_for(std::chrono::milliseconds(50));  // admitted before the others
  // Two whole frames, written a piece at a time in turn, so that both are half read at once.
  RawConnection writers[] = {RawConnection(harness.socket_path()),
                             RawConnection(harness.socket_path())};
  std::thread interleave([&] {
    std::string left[] = {request(2), request(3)};
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while ((!left[0].empty() || !left[1].empty()) && std::chrono::steady_clock::now() < deadline) {
      bool sent = false;
      for (int i = 0; i < 2; ++i) {
        const ssize_t n =
            ::send(writers[i].fd(), left[i].data(), std::min<std::size_t>(left[i].size(), 65536),
                   MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n > 0) left[i].erase(0, static_cast<std::size_t>(n));
        sent = sent || n > 0;
      }
      if (!sent) std::this_thread::sleep_for(std::chrono::microseconds(100));
    }
  });
  const auto error = stalled.ReadFrame();
  ASSERT_TRUE(error && error->as_array() && error->as_array()->at(1).as_dictionary());
  EXPECT_EQ(*error->as_array()->at(1).as_dictionary()->Find("code"),
            Value(static_cast<std::int64_t>(ConnectionError::kBadMessagePack)));
  for (std::uint32_t i = 0; i < 2; ++i) {
    const auto reply = writers[i].ReadFrame(std::chrono::seconds(10));
    EXPECT_EQ(reply, Value(Array{i + 2, true}))
        << i << " " << (reply ? reply->Description() : "none");
  }
  interleave.join();
}

// A reply too large for a frame is never dropped in silence: the connection gets the error
// frame (code 9) after the replies before it, and is closed.
TEST(LinuxIpcTest, AReplyTooLargeForAFrameClosesWithTheErrorFrame) {
  ListenerHarness harness([](Op op, const Array& args, IpcReply reply) {
    if (op == Op::kGetAllReporters) return reply(Value(std::string(2 << 20, 'x')));
    FakeExportedObject::DefaultReply(op, args, reply);
  });
  RawConnection raw(harness.socket_path());
  ASSERT_TRUE(raw.Write(ValidRequests(1, 1) + RawConnection::Frame(Value(Array{10, 2}))));
  bool closed = false;
  const std::vector<Value> frames = raw.ReadUntilClosed(&closed);
  EXPECT_TRUE(closed);
  ASSERT_EQ(frames.size(), 2u);
  EXPECT_EQ(frames[0].as_array()->front(), Value(1));
  EXPECT_EQ(*frames[1].as_array()->at(1).as_dictionary()->Find("code"),
            Value(static_cast<std::int64_t>(ConnectionError::kReplyTooLarge)));
}

// A peer that ends its stream right after its requests still gets their replies, even
// those made after the end of stream was read, and then the close.
TEST(LinuxIpcTest, APeerThatEndsItsStreamIsAnsweredBeforeTheClose) {
  std::mutex mu;
  std::vector<IpcReply> kept;
  ListenerHarness harness([&](Op op, const Array& args, IpcReply reply) {
    if (args[0] == Value(1)) return FakeExportedObject::DefaultReply(op, args, reply);
    std::lock_guard lock(mu);
    kept.push_back(std::move(reply));
  });
  RawConnection raw(harness.socket_path());
  ASSERT_TRUE(raw.Write(RawConnection::Frame(Value(Array{9, 1, 1}))) && raw.ReadFrame());
  auto object = harness.delegate().accepted().at(0).object.lock();
  object->HoldTakenIn(true);
  ASSERT_TRUE(raw.Write(ValidRequests(2, 10)));
  raw.EndStream();
  ASSERT_TRUE(Eventually([&] { return object->requests == 10; }));
  std::this_thread::sleep_for(std::chrono::milliseconds(50));  // the end of stream is read
  {
    std::lock_guard lock(mu);
    for (auto& reply : kept) reply(Value(true));
  }
  object->HoldTakenIn(false);
  bool closed = false;
  EXPECT_EQ(raw.ReadUntilClosed(&closed).size(), 9u);
  EXPECT_TRUE(closed);
}

// A socket file whose listener is gone (closed without unlinking) is replaced; a path that
// is not a socket is refused and kept.
TEST(LinuxIpcListenerSetupTest, StaleSocketsAreReplacedOtherFilesRefused) {
  TempDir dir;
  const std::string path = dir.File("reporting.sock");
  const int stale = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(stale, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ::close(stale);
  {
    ListenerHarness harness(nullptr, {}, path);
    auto client = Connect(path);
    EXPECT_TRUE(client && client->createReportingSessionSync(1) == true);
  }
  ::close(::open(path.c_str(), O_CREAT | O_WRONLY, 0600));
  ListenerHarness refused(nullptr, {}, path);
  EXPECT_FALSE(refused.listening());
  EXPECT_NE(refused.error().find("not a socket"), std::string::npos) << refused.error();
  struct stat info;
  ASSERT_EQ(::lstat(path.c_str(), &info), 0);
  EXPECT_TRUE(S_ISREG(info.st_mode));
}

// The service's connection error frame reaches the client's handler; a reply of the wrong
// type ends the connection with a local error, its callback never called.
TEST(ClientTest, ErrorFramesAndBadRepliesEndTheConnectionWithTheirError) {
  ListenerHarness harness([](Op, const Array&, IpcReply reply) { reply(Value("yes")); });
  for (const bool bad_reply : {false, true}) {
    auto client = Connect(harness.socket_path());
    ASSERT_TRUE(client);
    std::promise<client::ConnectionError> error;  // a second error would throw
    client->SetConnectionErrorHandler(
        [&](const client::ConnectionError& e) { error.set_value(e); });
    bool called = false;
    if (bad_reply) client->createReportingSession(1, [&](bool) { called = true; });
    if (!bad_reply) client->SendRequest(static_cast<Op>(40), {}, nullptr);
    EXPECT_TRUE(client->WaitUntilEnded());
    const auto e = error.get_future().get();
    EXPECT_EQ(e.domain, bad_reply ? client::kClientErrorDomain : protocol::kIpcErrorDomain);
    EXPECT_EQ(e.code, bad_reply ? static_cast<std::int64_t>(client::ClientErrorCode::kBadReply)
                                : static_cast<std::int64_t>(ConnectionError::kUnknownOp));
    EXPECT_TRUE(bad_reply || e.message.find("40") != std::string::npos) << e.message;
    EXPECT_FALSE(called);
  }
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

// A request too large for a frame is not sent; a blocking call from a callback (on the
// connection's thread) returns instead of deadlocking.
TEST(ClientTest, OversizedRequestsAndBlockingCallsFromCallbacksFailAtOnce) {
  ListenerHarness harness;
  auto client = Connect(harness.socket_path());
  ASSERT_TRUE(client);
  Value huge(Dictionary{{"blob", std::string(protocol::kMaxBodyBytes, 'x')}});
  EXPECT_EQ(client->sendMessage(huge, 1, 1, std::nullopt, nullptr), 0u);
  EXPECT_EQ(client->outstanding(), 0u);
  std::promise<std::optional<bool>> inner;
  client->createReportingSession(1, [&](bool) {
    inner.set_value(client->createReportingSessionSync(2, std::chrono::seconds(30)));
  });
  auto future = inner.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_EQ(future.get(), std::nullopt);
}

TEST(CApiTest, EveryOperationFromC) {
  ListenerHarness harness([](protocol::Op op, const Array& args, IpcReply reply) {
    // sendMessage without reporter IDs is refused, as with reporting disabled.
    if (op == protocol::Op::kSendMessage && args[3].is_null()) {
      reply(Value(Dictionary{
          {"domain", "com.norvel.audio.reporting"}, {"code", 1}, {"userInfo", Value()}}));
      return;
    }
    FakeExportedObject::DefaultReply(op, args, reply);
  });
  EXPECT_EQ(qn_c_api_round_trip(harness.socket_path().c_str()), 0);
  EXPECT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
}

TEST(CApiTest, ConnectFailureDescribesTheProblem) {
  TempDir dir;
  char error[256] = "untouched";
  const std::string path = dir.path() + "/none.sock";
  EXPECT_EQ(qn_client_connect(path.c_str(), error, sizeof error), nullptr);
  EXPECT_NE(std::string(error).find("none.sock"), std::string::npos) << error;
  qn_client_free(nullptr);
  EXPECT_EQ(qn_client_create_session(nullptr, 1, 0), QN_BAD_ARGUMENT);
}

TEST(PathsTest, HomeRootAndOtherUsersFolders) {
  PathEnvironment root;                  // uid 0
  root.xdg_runtime_dir = "/run/user/0";  // ignored for root
  PathEnvironment user;
  user.uid = 1000, user.xdg_runtime_dir = "/run/user/1000", user.xdg_state_home = "/home/u/.state";
  user.home = "/home/u";
  PathEnvironment bare = user;  // without the XDG variables: no folder in /tmp
  bare.xdg_runtime_dir = bare.xdg_state_home = std::nullopt;
  PathEnvironment unit = bare;  // a system user under systemd
  unit.runtime_directory = "/run/quenta", unit.state_directory = "/var/lib/quenta";
  unit.logs_directory = "/var/log/quenta";
  const struct {
    Paths paths;
    const char *runtime, *state, *log;
  } rows[] = {
      {ResolvePaths(PathOptions{"/srv/q/", std::nullopt}, root), "/srv/q/run", "/srv/q/state",
       "/srv/q/log"},
      {ResolvePaths({}, root), "/run/quenta", "/var/lib/quenta", "/var/log/quenta"},
      {ResolvePaths({}, user), "/run/user/1000/quenta", "/home/u/.state/quenta",
       "/home/u/.state/quenta/log"},
      {ResolvePaths({}, bare), "", "/home/u/.local/state/quenta",
       "/home/u/.local/state/quenta/log"},
      {ResolvePaths({}, unit), "/run/quenta", "/var/lib/quenta", "/var/log/quenta"},
  };
  for (const auto& row : rows) {
    const std::string runtime = row.runtime;
    EXPECT_EQ(row.paths.runtime_dir, runtime);
    EXPECT_EQ(row.paths.state_dir, row.state);
    EXPECT_EQ(row.paths.log_dir, row.log);
    EXPECT_EQ(row.paths.socket_path, runtime.empty() ? "" : runtime + "/reporting.sock");
    EXPECT_EQ(row.paths.problem.empty(), !runtime.empty()) << row.paths.problem;
  }
}

}  // namespace
}  // namespace qn::testing
