// Malformed input end to end: each bad connection gets the connection error frame or a
// clean close, while a well-behaved client connected the whole time sees no difference.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <set>
#include <thread>

#include "common/Protocol.h"
#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using protocol::ConnectionError;

class BadInputTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(daemon_.started());
    witness_ = daemon_.Connect();
    ASSERT_TRUE(witness_);
    witness_->SetInvalidationHandler([this] { witness_ended_ = true; });
    ASSERT_EQ(witness_->createReportingSessionSync(5), true);
    ASSERT_EQ(witness_->setServiceTypeSync(2, 5), true);
    witness_->startReportingSessionForID(5, nullptr);
    ExpectWitnessUnaffected();
  }

  void TearDown() override {
    ExpectWitnessUnaffected();
    EXPECT_TRUE(daemon_.process().running());
  }

  // The witness's connection, session and replies are as they were.
  void ExpectWitnessUnaffected() {
    ASSERT_TRUE(witness_);
    EXPECT_TRUE(witness_->connected());
    EXPECT_FALSE(witness_ended_.load());
    EXPECT_EQ(witness_->reporterIDValidSync(5),
              (Dictionary{{"reporterID", 5}, {"serviceType", 2}}));
    EXPECT_TRUE(RepliedWithoutError(witness_->sendMessageSync(Value(Dictionary{{"still", "here"}}),
                                                              1, 1, std::vector<std::int64_t>{5})));
    EXPECT_EQ(witness_->getAllReportersSync(), std::vector<std::int64_t>{5});
  }

  // Sends `bytes` on a fresh raw connection (after one good request, to show the connection
  // worked), and expects the error frame with `code` followed by the close.
  void ExpectErrorFrameAndClose(const std::string& bytes, ConnectionError code) {
    RawConnection raw(daemon_.socket_path());
    ASSERT_TRUE(raw.Write(RawConnection::Frame(Value(Array{10, 77}))));
    EXPECT_EQ(raw.ReadFrame(), Value(Array{77, Value(Array{5})}));
    raw.Write(bytes);  // the daemon may close before it has read everything
    bool closed = false;
    std::vector<Value> frames = raw.ReadUntilClosed(&closed);
    EXPECT_TRUE(closed);
    ASSERT_EQ(frames.size(), 1u);
    EXPECT_EQ(ErrorCode(frames[0]), static_cast<std::int64_t>(code)) << frames[0].Description();
  }

  Daemon daemon_;
  std::unique_ptr<client::Client> witness_;
  std::atomic<bool> witness_ended_{false};
};

// One input of each kind the daemon refuses (the listener tests go through them all).
TEST_F(BadInputTest, EachKindGetsItsErrorFrameAndOnlyThatConnectionCloses) {
  const std::pair<std::string, ConnectionError> cases[] = {
      // "this" read as a length is far over the limit.
      {"this is not a frame at all\n", ConnectionError::kBadLength},
      {std::string("\x00\x10\x00\x01", 4).append(4096, 'x'), ConnectionError::kBadLength},
      {RawConnection::RawFrame(std::string("\x92\x01", 2)), ConnectionError::kBadMessagePack},
      {RawConnection::RawFrame(std::string(1000, '\x91').append("\xc0")),
       ConnectionError::kTooDeep},
      {RawConnection::Frame(Value("hello")), ConnectionError::kBadRequest},
      {RawConnection::Frame(Value(Array{12, 1})), ConnectionError::kUnknownOp},
      {RawConnection::Frame(Value(Array{2, 1, 70000, 5})), ConnectionError::kBadArguments},
      {RawConnection::Frame(Value(Array{6, 1, Value(Array{}), 1, 1, Value()})),
       ConnectionError::kBadArguments},
      {RawConnection::Frame(Value(Array{6, 1, Value(Dictionary{}), 1, 1, Value(Array(257, 5))})),
       ConnectionError::kBadArguments},
  };
  for (const auto& [bytes, code] : cases) {
    SCOPED_TRACE(static_cast<int>(code));
    ExpectErrorFrameAndClose(bytes, code);
    ExpectWitnessUnaffected();
  }
}

// A client that floods without reading is no longer read once its replies pile up (the
// daemon would close it at 8 MiB of unread replies); the witness is served meanwhile; when
// the flooder reads, every request it sent has its reply, in order.
TEST_F(BadInputTest, AFloodingClientIsHeldBackAndLosesNothing) {
  RawConnection flood(daemon_.socket_path(), /*receive_buffer=*/4096);
  ASSERT_TRUE(flood.connected());
  constexpr std::uint32_t kRequests = 100'000;  // about 4 MB of replies
  std::string requests;
  for (std::uint32_t id = 1; id <= kRequests; ++id) {
    requests += RawConnection::Frame(Value(Array{9, id, 123456789}));
  }
  std::thread writer([&] { EXPECT_TRUE(flood.Write(requests)); });
  EXPECT_TRUE(daemon_.WaitForStat({"paused", "replies"}, 1));
  ExpectWitnessUnaffected();
  for (std::uint32_t id = 1; id <= kRequests; ++id) {
    ASSERT_EQ(flood.ReadFrame(),  // the reply for an unknown reporter
              Value(Array{id, Value(Dictionary{{"reporterID", 0}, {"serviceType", 65535}})}));
  }
  writer.join();
}

// Requests read before a bad frame are all answered before its error frame, even when
// their replies take the slowest path (a stop's reply waits for its summary file).
TEST(FlowControlTest, RepliesOfRequestsReadBeforeABadFrameComeFirst) {
  Daemon daemon({"--internal-build"});
  ASSERT_TRUE(daemon.started());
  for (int round = 0; round < 5; ++round) {
    RawConnection raw(daemon.socket_path());
    std::string bytes;
    std::set<std::int64_t> expected;
    std::uint32_t id = 0;
    for (std::int64_t reporter = 1; reporter <= 40; ++reporter) {
      for (const Array& request : {Array{1, ++id, reporter}, Array{5, ++id, reporter},
                                   Array{9, ++id, reporter}, Array{7, ++id, reporter}}) {
        bytes += RawConnection::Frame(Value(request));
        expected.insert(request[1].as_int64().value_or(0));
      }
    }
    bytes += RawConnection::Frame(Value("not a request"));
    ASSERT_TRUE(raw.Write(bytes));
    bool closed = false;
    std::vector<Value> frames = raw.ReadUntilClosed(&closed);
    EXPECT_TRUE(closed);
    ASSERT_EQ(frames.size(), expected.size() + 1) << "round " << round;
    std::set<std::int64_t> answered;
    for (std::size_t i = 0; i + 1 < frames.size(); ++i) {
      answered.insert(frames[i].as_array()->front().as_int64().value_or(0));
    }
    EXPECT_EQ(answered, expected);
    EXPECT_EQ(ErrorCode(frames.back()), static_cast<std::int64_t>(ConnectionError::kBadRequest));
  }
}

// Beyond --max-connections a connection gets the error frame (code 8) and is closed; the
// ones already open go on, and a place that frees up can be taken again.
TEST(FlowControlTest, ConnectionsBeyondTheLimitGetTheErrorFrame) {
  Daemon daemon({"--max-connections", "2"});
  ASSERT_TRUE(daemon.started());
  auto first = daemon.Connect();
  auto second = daemon.Connect();
  ASSERT_TRUE(first && second && first->getAllReportersSync() && second->getAllReportersSync());
  RawConnection third(daemon.socket_path());
  bool closed = false;
  std::vector<Value> frames = third.ReadUntilClosed(&closed);
  EXPECT_TRUE(closed);
  ASSERT_EQ(frames.size(), 1u);
  EXPECT_EQ(ErrorCode(frames[0]), static_cast<std::int64_t>(ConnectionError::kTooManyConnections));
  EXPECT_TRUE(first->getAllReportersSync());
  first.reset();
  EXPECT_TRUE(daemon.WaitForStat({"refused", "connections"}, 1));
  auto again = daemon.Connect();
  EXPECT_TRUE(again && again->getAllReportersSync());
}

// A stderr whose reader left, or that nobody reads, neither kills nor blocks the daemon:
// the lines are dropped and counted.
TEST(FlowControlTest, AStderrThatIsGoneOrFullNeverStopsTheDaemon) {
  for (const bool reader_left : {true, false}) {
    SCOPED_TRACE(reader_left ? "reader left" : "nobody reads");
    int fds[2];
    ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
    if (reader_left) ::close(fds[0]);
    Daemon daemon({"--debug", "all"}, std::nullopt, fds[1]);
    ::close(fds[1]);
    ASSERT_TRUE(daemon.started());
    RawConnection raw(daemon.socket_path());
    // Each message's debug lines print its 50 KB payload: far more than a pipe holds.
    constexpr std::uint32_t kRequests = 200;
    const Value payload(Dictionary{{"blob", std::string(50'000, 'x')}});
    std::string bytes;
    for (std::uint32_t id = 1; id <= kRequests; ++id) {
      bytes += RawConnection::Frame(Value(Array{6, id, payload, 1, 1, Value()}));
    }
    ASSERT_TRUE(raw.Write(bytes));
    for (std::uint32_t id = 1; id <= kRequests; ++id) {
      ASSERT_EQ(raw.ReadFrame(), Value(Array{id, Value()}));
    }
    EXPECT_TRUE(daemon.WaitForStat({"log_lines_dropped"}, 1));
    EXPECT_TRUE(daemon.process().running());
    if (!reader_left) ::close(fds[0]);
  }
}

}  // namespace
}  // namespace qn::e2e
