// The peer's uid as the boundary, through the real daemon run as root: clients forked off
// as another uid (65534) may not end the daemon, reach root's sessions or take more than
// their share, and what they send cannot make the daemon hold more than its budgets.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "common/Protocol.h"
#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using protocol::ConnectionError;
constexpr uid_t kOther = 65534;

Value Ask(RawConnection& raw, const Array& request) {
  raw.Write(RawConnection::Frame(Value(request)));
  return raw.ReadFrame().value_or(Value("closed"));
}
// The code of the error frame that ended the connection (-1: none).
std::int64_t ClosedWith(RawConnection& raw) {
  bool closed = false;
  std::vector<Value> frames = raw.ReadUntilClosed(&closed);
  return closed && !frames.empty() ? ErrorCode(frames.back()) : -1;
}
constexpr auto Code = [](ConnectionError code) { return static_cast<std::int64_t>(code); };

class PeerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root, to fork clients of another uid";
  }
};

// Another uid neither sees, starts nor sends to root's session; --shared-sessions lets it.
// killService: from another uid gets the error frame and the daemon goes on; root's works.
TEST_F(PeerTest, AnotherUidReachesRootsSessionsOnlyWhenShared) {
  for (const bool shared : {false, true}) {
    SCOPED_TRACE(shared ? "shared" : "scoped");
    Daemon daemon(shared ? std::vector<std::string>{"--shared-sessions"}
                         : std::vector<std::string>{});
    ASSERT_TRUE(daemon.started());
    auto root = daemon.Connect();
    auto other = daemon.ConnectAs(kOther);
    ASSERT_TRUE(root && other);
    ASSERT_EQ(root->createReportingSessionSync(7), true);
    ASSERT_EQ(root->setServiceTypeSync(2, 7), true);
    const Value unknown(Dictionary{{"reporterID", 0}, {"serviceType", 65535}});
    const struct {
      Array request;
      Value scoped, sharedReply;
    } cases[] = {
        {{10, 1}, Value(Array{}), Value(Array{7})},
        {{9, 2, 7}, unknown, Value(Dictionary{{"reporterID", 7}, {"serviceType", 2}})},
        {{3, 3, 7}, Value(65535), Value(2)},
        {{6, 4, Value(Dictionary{{"from", "other"}}), 1, 1, Value(Array{7})}, Value(), Value()},
    };
    for (const auto& c : cases) {
      EXPECT_EQ(Ask(*other, c.request),
                Value(Array{c.request[1], shared ? c.sharedReply : c.scoped}));
    }
    // A start of root's session keeps its reply in that session: the next reply comes first.
    other->Write(RawConnection::Frame(Value(Array{5, 5, 7})));
    EXPECT_EQ(Ask(*other, {10, 6}).as_array()->front(), Value(shared ? 6 : 5));
    // The message the other uid sent to 7 reached it only when shared.
    ASSERT_TRUE(RepliedWithoutError(
        root->sendMessageSync(Value(Dictionary{{"mark", 1}}), 1, 1, std::vector<std::int64_t>{7})));
    const auto stored = [&daemon](const char* text) {
      const auto rows = daemon.Rows();
      return std::any_of(rows.begin(), rows.end(), [text](const auto& row) {
        return row.payload.find(text) != std::string::npos;
      });
    };
    ASSERT_TRUE(Eventually([&] { return stored("mark"); }));
    EXPECT_EQ(stored("other"), shared);
    other->Write(RawConnection::Frame(Value(Array{11, 7})));
    EXPECT_EQ(ClosedWith(*other), Code(ConnectionError::kNotPermitted));
    root->killService(nullptr);
    EXPECT_EQ(daemon.process().Wait(), Exited(2));
  }
}

// The other uid's third connection is refused and its fourth session not made (YES all the
// same), while root still connects and creates.
TEST_F(PeerTest, PerUidLimitsLeaveRoomForRoot) {
  Daemon daemon({"--max-connections-per-uid", "2", "--max-sessions-per-uid", "3"});
  ASSERT_TRUE(daemon.started());
  auto first = daemon.ConnectAs(kOther);
  auto second = daemon.ConnectAs(kOther);
  auto third = daemon.ConnectAs(kOther);
  ASSERT_TRUE(first && second && third);
  EXPECT_EQ(ClosedWith(*third), Code(ConnectionError::kTooManyConnections));
  for (std::uint32_t id = 1; id <= 4; ++id) {  // both connections' sessions count
    EXPECT_EQ(Ask(id % 2 ? *first : *second, {1, id, id}), Value(Array{id, true}));
  }
  auto root = daemon.Connect();
  ASSERT_TRUE(root);
  EXPECT_EQ(root->createReportingSessionSync(9), true);
  EXPECT_EQ(root->getAllReportersSync(), (std::vector<std::int64_t>{1, 3, 2, 9}));
}

// What the other uid sends on its connections (each with session 1 of the service type
// given), and how much the daemon's peak resident memory may grow meanwhile, measured once
// the daemon has settled (unbounded, each of these took hundreds of MiB).
TEST_F(PeerTest, ByteBudgetsBoundWhatAUserCanMakeTheDaemonHold) {
  const Value blob50k(Dictionary{{"blob", std::string(50'000, 'x')}});
  const Value blob500k(Dictionary{{"blob", std::string(500'000, 'x')}});
  const auto configuration = [](std::uint32_t id) {
    Dictionary keys;
    for (int key = 0; key < 40'000; ++key) keys.Set(std::to_string(id * 100'000 + key), key);
    return Value(std::move(keys));
  };
  const struct {
    const char* name;
    int serviceType, connections;
    std::uint32_t requests;
    std::function<Array(std::uint32_t id)> request;  // none: a frame that never ends
    std::function<bool(Daemon&)> settled;
    std::size_t bound;
  } cases[] = {
      {"8 sends of 50 KB to one ID listed 256 times", 2, 1, 8,
       [&](std::uint32_t id) { return Array{6, id, blob50k, 1, 1, Value(Array(256, Value(1)))}; },
       [](Daemon& d) {
         return d.WaitForStat({"store", "committed"}, 2 * 8 * 256);
       },
       128u << 20},
      {"400 alarms of 500 KB of a session never started", 4, 1, 400,
       [&](std::uint32_t id) { return Array{6, id, blob500k, 1, 1, Value()}; },
       [](Daemon& d) {
         return d.WaitForStat({"paused", "store"}, 1);
       },
       48u << 20},
      {"16 configurations of 40,000 keys", 2, 1, 16,
       [&](std::uint32_t id) {
         return Array{4, id, configuration(id), 1};
       },
       [](Daemon& d) { return d.WaitForStat({"configuration_capped"}, 16); }, 48u << 20},
      {"64 frames of 1 MiB that never end (time-out: 1 s)", 2, 64, 0, nullptr,
       [](Daemon& d) {
         return d.WaitForStat({"refused", "partial_frames"}, 16);
       },
       32u << 20},
  };
  std::string endless("\x00\x10\x00\x00", 4);  // announces a 1 MiB body, one byte short
  endless.append(protocol::kMaxBodyBytes - 1, '\xc0');
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    Daemon daemon({"--partial-frame-timeout", "1"});
    ASSERT_TRUE(daemon.started());
    const std::size_t before = daemon.PeakRss();
    std::vector<std::unique_ptr<RawConnection>> others;
    std::vector<std::thread> writers;
    for (int i = 0; i < c.connections; ++i) {
      others.push_back(daemon.ConnectAs(kOther));
      ASSERT_TRUE(others.back());
      ASSERT_EQ(Ask(*others.back(), {1, 1, 1}), Value(Array{1, true}));
      ASSERT_EQ(Ask(*others.back(), {2, 2, c.serviceType, 1}), Value(Array{2, true}));
      std::string bytes(c.request ? std::string_view() : std::string_view(endless));
      for (std::uint32_t id = 3; id < 3 + c.requests; ++id) {
        bytes += RawConnection::Frame(Value(c.request(id)));
      }
      writers.emplace_back([raw = others.back().get(), bytes] { raw->Write(bytes); });
    }
    EXPECT_TRUE(c.settled(daemon));
    for (auto& raw : others) ::shutdown(raw->fd(), SHUT_RDWR);
    for (auto& writer : writers) writer.join();
    auto root = daemon.Connect();
    ASSERT_TRUE(root && root->getAllReportersSync());
    const std::size_t grew = daemon.PeakRss() - before;
    EXPECT_LT(grew, c.bound) << grew / 1024 << " KiB";
  }
}

}  // namespace
}  // namespace qn::e2e
