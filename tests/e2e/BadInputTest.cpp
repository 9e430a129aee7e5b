// Malformed input end to end: each bad connection gets the connection error frame or a
// clean close, while a well-behaved client connected the whole time sees no difference.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <utility>
#include <vector>

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
    ASSERT_TRUE(raw.connected());
    ASSERT_TRUE(raw.Write(RawConnection::Frame(Value(Array{10, 77}))));
    EXPECT_EQ(raw.ReadFrame(), Value(Array{77, Value(Array{5})}));
    raw.Write(bytes);  // the daemon may close before it has read everything
    bool closed = false;
    std::vector<Value> frames = raw.ReadUntilClosed(&closed);
    EXPECT_TRUE(closed);
    ASSERT_EQ(frames.size(), 1u);
    const Array* error = frames[0].as_array();
    ASSERT_TRUE(error && error->size() == 2u) << frames[0].Description();
    EXPECT_EQ((*error)[0], Value(0));
    const Dictionary* body = (*error)[1].as_dictionary();
    ASSERT_TRUE(body);
    EXPECT_EQ(*body->Find("domain"), Value("com.norvel.quenta.ipc"));
    EXPECT_EQ(*body->Find("code"), Value(static_cast<std::int64_t>(code)));
    ASSERT_TRUE(body->Find("message") && body->Find("message")->is_string());
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
      {RawConnection::RawFrame(std::string(1000, '\x91').append("\xc0")), ConnectionError::kTooDeep},
      {RawConnection::Frame(Value("hello")), ConnectionError::kBadRequest},
      {RawConnection::Frame(Value(Array{12, 1})), ConnectionError::kUnknownOp},
      {RawConnection::Frame(Value(Array{2, 1, 70000, 5})), ConnectionError::kBadArguments},
      {RawConnection::Frame(Value(Array{6, 1, Value(Array{}), 1, 1, Value()})),
       ConnectionError::kBadArguments},
  };
  for (const auto& [bytes, code] : cases) {
    SCOPED_TRACE(static_cast<int>(code));
    ExpectErrorFrameAndClose(bytes, code);
    ExpectWitnessUnaffected();
  }
}

TEST_F(BadInputTest, AClientThatNeverReadsIsClosed) {
  RawConnection raw(daemon_.socket_path(), /*receive_buffer=*/4096);
  ASSERT_TRUE(raw.connected());
  // 2,000 sessions make each getAllReporters reply about 10 KB; 1,200 of them queue far more
  // than the daemon keeps for a peer that does not read.
  std::string requests;
  std::uint32_t request_id = 1;
  for (std::int64_t i = 0; i < 2000; ++i) {
    requests += RawConnection::Frame(Value(Array{1, request_id++, 1'000'000'000 + i}));
  }
  for (int i = 0; i < 1200; ++i) requests += RawConnection::Frame(Value(Array{10, request_id++}));
  raw.Write(requests);  // may fail part-way once the daemon closes the connection
  EXPECT_TRUE(raw.WaitForPeerClose());
  EXPECT_THAT(daemon_.process().Stderr(), ::testing::HasSubstr("peer does not read its replies"));
}

}  // namespace
}  // namespace qn::e2e
