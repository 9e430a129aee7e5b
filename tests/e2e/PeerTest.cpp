// The peer's uid as the boundary, through the real daemon run as root: clients forked off
// as another uid (65534) may not end the daemon, reach root's sessions or take more than
// their share, and what one request can make the daemon hold stays bounded.
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "common/Protocol.h"
#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using protocol::ConnectionError;
constexpr uid_t kOther = 65534;

class PeerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root, to fork clients of another uid";
  }
};

// killService: from another uid gets the error frame (code 10) and the daemon goes on;
// from root it ends the daemon with status 2.
TEST_F(PeerTest, OnlyRootEndsTheDaemon) {
  Daemon daemon;
  ASSERT_TRUE(daemon.started());
  auto other = daemon.ConnectAs(kOther);
  ASSERT_TRUE(other);
  ASSERT_TRUE(other->Write(RawConnection::Frame(Value(Array{11, 1}))));
  bool closed = false;
  std::vector<Value> frames = other->ReadUntilClosed(&closed);
  ASSERT_EQ(frames.size(), 1u);
  EXPECT_EQ(ErrorCode(frames[0]), static_cast<std::int64_t>(ConnectionError::kNotPermitted));
  EXPECT_TRUE(daemon.WaitForStat({"bad_frames", "10"}, 1));
  auto root = daemon.Connect();
  ASSERT_TRUE(root && root->getAllReportersSync());
  root->killService(nullptr);
  EXPECT_EQ(daemon.process().Wait(), Exited(2));
}

// Another uid neither sees, starts nor sends to root's session; --shared-sessions lets it.
TEST_F(PeerTest, AnotherUidReachesRootsSessionsOnlyWhenShared) {
  for (const bool shared : {false, true}) {
    SCOPED_TRACE(shared ? "shared" : "scoped");
    Daemon daemon(shared ? std::vector<std::string>{"--shared-sessions"}
                         : std::vector<std::string>{});
    ASSERT_TRUE(daemon.started());
    auto root = daemon.Connect();
    ASSERT_TRUE(root);
    ASSERT_EQ(root->createReportingSessionSync(7), true);
    ASSERT_EQ(root->setServiceTypeSync(2, 7), true);
    auto other = daemon.ConnectAs(kOther);
    ASSERT_TRUE(other);
    const Value unknown(Dictionary{{"reporterID", 0}, {"serviceType", 65535}});
    const Value found(Dictionary{{"reporterID", 7}, {"serviceType", 2}});
    const struct {
      Array request;
      Value scoped, sharedReply;
    } cases[] = {
        {{10, 1}, Value(Array{}), Value(Array{7})},
        {{9, 2, 7}, unknown, found},
        {{3, 3, 7}, Value(65535), Value(2)},
        {{6, 4, Value(Dictionary{{"from", "other"}}), 1, 1, Value(Array{7})}, Value(), Value()},
    };
    for (const auto& c : cases) {
      ASSERT_TRUE(other->Write(RawConnection::Frame(Value(c.request))));
      EXPECT_EQ(other->ReadFrame(), Value(Array{c.request[1], shared ? c.sharedReply : c.scoped}));
    }
    // A start from the other uid keeps its reply back only when it started root's session.
    ASSERT_TRUE(other->Write(RawConnection::Frame(Value(Array{5, 5, 7}))));
    ASSERT_TRUE(other->Write(RawConnection::Frame(Value(Array{10, 6}))));
    EXPECT_EQ(other->ReadFrame()->as_array()->front(), Value(shared ? 6 : 5));
    // The message the other uid sent to 7 reached it only when shared.
    ASSERT_TRUE(RepliedWithoutError(
        root->sendMessageSync(Value(Dictionary{{"mark", 1}}), 1, 1, std::vector<std::int64_t>{7})));
    ASSERT_TRUE(daemon.WaitForRows([](const auto& rows) {
      for (const auto& row : rows)
        if (row.payload.find("mark") != std::string::npos) return true;
      return false;
    }));
    bool reached = false;
    for (const auto& row : daemon.Rows()) reached |= row.payload.find("other") != std::string::npos;
    EXPECT_EQ(reached, shared);
  }
}

}  // namespace
}  // namespace qn::e2e
