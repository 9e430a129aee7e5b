// The peer's uid as the boundary, through the real daemon run as root: clients forked off
// as another uid (65534) may not end the daemon, reach root's sessions or take more than
// their share, and what they send cannot make the daemon hold more than its budgets.
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "common/Protocol.h"
#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

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

// Another uid neither sees (valid, getAllReporters; service types are found the same way),
// starts nor sends to root's session; --shared-sessions lets it.
// killService: from another uid gets the error frame and the daemon goes on; root's works.
TEST(PeerTest, AnotherUidReachesRootsSessionsOnlyWhenShared) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root, to fork clients of another uid";
  for (const bool shared : {false, true}) {
    SCOPED_TRACE(shared ? "shared" : "scoped");
    Daemon daemon(shared ? std::vector<std::string>{"--shared-sessions"}
                         : std::vector<std::string>{});
    ASSERT_TRUE(daemon.started());
    auto root = daemon.Connect();
    auto other = daemon.ConnectAs(kOther);
    ASSERT_TRUE(root && other);
    ASSERT_EQ(root->createReportingSessionSync(7), true);
    const struct {
      Array request;
      Value scoped, sharedReply;
    } cases[] = {
        {{10, 1}, Value(Array{}), Value(Array{7})},
        {{9, 2, 7},
         Value(Dictionary{{"reporterID", 0}, {"serviceType", 65535}}),
         Value(Dictionary{{"reporterID", 7}, {"serviceType", 65535}})},
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
      for (const auto& row : daemon.Rows()) {
        if (row.payload.find(text) != std::string::npos) return true;
      }
      return false;
    };
    ASSERT_TRUE(Eventually([&] { return stored("mark"); }));
    EXPECT_EQ(stored("other"), shared);
    other->Write(RawConnection::Frame(Value(Array{11, 7})));
    EXPECT_EQ(ClosedWith(*other), std::int64_t{10});
    root->killService(nullptr);
    EXPECT_EQ(daemon.process().Wait(), Exited(2));
  }
}

// The other uid's third connection is refused (its sessions are limited the same way, see
// SessionLimitTest), while root still connects.
TEST(PeerTest, PerUidLimitsLeaveRoomForRoot) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root, to fork clients of another uid";
  Daemon daemon({"--max-connections-per-uid", "2"});
  ASSERT_TRUE(daemon.started());
  auto first = daemon.ConnectAs(kOther), second = daemon.ConnectAs(kOther);
  auto third = daemon.ConnectAs(kOther);
  ASSERT_TRUE(first && second && third);
  EXPECT_EQ(ClosedWith(*third), std::int64_t{8});
  auto root = daemon.Connect();
  EXPECT_TRUE(root && root->getAllReportersSync());
}

// Not under a sanitizer, whose shadow memory counts in the daemon's resident size.
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
// Runs a daemon; the other uid opens `connections` connections, each with session 1 of
// `serviceType`, and writes `bytes` on each; once the stat at `settled` reaches `least`, the
// daemon's peak resident memory must have grown by less than `bound` (measured after the
// fact; unbounded, each load below took hundreds of MiB).
void ExpectPeakWithin(const char* name, std::size_t bound, int serviceType, int connections,
                      const std::string& bytes, const std::vector<const char*>& settled,
                      std::int64_t least) {
  SCOPED_TRACE(name);
  Daemon daemon({"--partial-frame-timeout", "1"});
  ASSERT_TRUE(daemon.started());
  const std::size_t before = daemon.PeakRss();
  std::vector<std::unique_ptr<RawConnection>> others;
  std::vector<std::thread> writers;
  for (int i = 0; i < connections; ++i) {
    others.push_back(daemon.ConnectAs(kOther));
    ASSERT_TRUE(others.back());
    ASSERT_EQ(Ask(*others.back(), {1, 1, 1}), Value(Array{1, true}));
    ASSERT_EQ(Ask(*others.back(), {2, 2, serviceType, 1}), Value(Array{2, true}));
    writers.emplace_back([raw = others.back().get(), &bytes] { raw->Write(bytes); });
  }
  EXPECT_TRUE(daemon.WaitForStat(settled, least));
  // The budgets met are the other uid's: root's messages still go in (the second is the one
  // a hold would keep unread).
  auto root = daemon.Connect();
  ASSERT_TRUE(root);
  for (int i = 0; i < 2; ++i) {
    EXPECT_TRUE(RepliedWithoutError(
        root->sendMessageSync(Value(Dictionary{{"from", "root"}}), 1, 1, std::nullopt)));
  }
  for (auto& raw : others) ::shutdown(raw->fd(), SHUT_RDWR);
  for (auto& writer : writers) writer.join();
  const std::size_t grew = daemon.PeakRss() - before;
  EXPECT_LT(grew, bound) << grew / 1024 << " KiB";
}

// Frames of requests 3, 4, ... `count` + 2, as `request` makes them.
std::string Requests(std::uint32_t count, const std::function<Array(std::uint32_t id)>& request) {
  std::string bytes;
  for (std::uint32_t id = 3; id < 3 + count; ++id)
    bytes += RawConnection::Frame(Value(request(id)));
  return bytes;
}

TEST(PeerTest, ByteBudgetsBoundWhatAUserCanMakeTheDaemonHold) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root, to fork clients of another uid";
  const Value blob50k(Dictionary{{"blob", std::string(50'000, 'x')}});
  ExpectPeakWithin("8 sends of 50 KB to one ID listed 256 times", 32u << 20, 2, 1,
                   Requests(8,
                            [&](std::uint32_t id) {
                              return Array{6, id, blob50k, 1, 1, Value(Array(256, Value(1)))};
                            }),
                   {"store", "committed"}, 2 * 8 * 256);
  const Value blob500k(Dictionary{{"blob", std::string(500'000, 'x')}});
  ExpectPeakWithin(
      "400 alarms of 500 KB of a session never started", 48u << 20, 4, 1,
      Requests(400,
               [&](std::uint32_t id) { return Array{6, id, blob500k, 1, 1, Value(Array{1})}; }),
      {"paused", "uid_parked_bytes"}, 1);
  ExpectPeakWithin("16 configurations of 40,000 keys", 48u << 20, 2, 1,
                   Requests(16,
                            [](std::uint32_t id) {
                              Dictionary keys;
                              for (int key = 0; key < 40'000; ++key)
                                keys.Set(std::to_string(id * 100'000 + key), key);
                              return Array{4, id, Value(std::move(keys)), 1};
                            }),
                   {"configuration_capped"}, 16);
  std::string endless("\x00\x10\x00\x00", 4);  // announces a 1 MiB body, one byte short
  endless.append(protocol::kMaxBodyBytes - 1, '\xc0');
  ExpectPeakWithin("64 frames of 1 MiB that never end (time-out: 1 s)", 32u << 20, 2, 64, endless,
                   {"refused", "partial_frames"}, 16);
}

#endif

}  // namespace
}  // namespace qn::e2e
