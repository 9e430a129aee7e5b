// Per-client request handling (the eleven operations as one or more clients see them), the
// service delegate (connections, client removal), the defaults with the reporting switch, the
// two bridges, and the block throttle (message keys, throttle times, the debounce on its own
// thread: real time with wide margins, checks of order and count).
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

#include "Statistics/QNReportingEnerdexUtility.h"
#include "Statistics/QNReportingStatlynBridge.h"
#include "Statistics/Service/QNReportingBlockThrottle.h"
#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using testing::BoolReplies;
using testing::Client;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using testing::FakeIpcConnection;
using testing::FakePlatform;
using ::testing::HasSubstr;
using testing::LogCapture;
using testing::Payload;
using testing::Replies;
using testing::ServiceHarness;

constexpr const char* kUptimeEvent = "com.norvel.quenta.qnreportingclientuptime";
constexpr const char* kSuite = "com.norvel.quenta";

class ServiceTest : public ::testing::Test {
 protected:
  ServiceHarness h_;
  testing::LogCapture& log_ = *h_.env.log;
  testing::FakeLivoReporting& livo_ = *h_.env.livo;
  Client a_ = h_.Connect(100);  // two clients, in this order
  Client b_ = h_.Connect(200);
};

// setServiceType touches only the caller's own sessions; the name lookup finds any client's.
TEST_F(ServiceTest, SetServiceTypeIsOwnSessionsOnlyGetServiceNameSearchesAll) {
  h_.Create(a_, 42);
  BoolReplies r;
  b_->setServiceType(2, 42, r.Callback());
  b_->setServiceType(2, 0, r.Callback());
  h_.Run();
  EXPECT_EQ(a_.Session(42)->serviceType(), 65535);
  EXPECT_EQ(log_.Count("set for reporter"), 0);

  a_->setServiceType(7, 42, r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(true, true, true));
  EXPECT_EQ(a_.Session(42)->serviceName(), "longformaudio");
  EXPECT_EQ(log_.Count(": service type 7 set for reporter  42"), 1);

  // The name lookup searches the clients in order; 0 finds nothing at first.
  a_->setServiceType(2, 42, r.Callback());
  Replies<std::uint16_t> names;
  b_->getServiceNameForReporterID(42, names.Callback());
  b_->getServiceNameForReporterID(43, names.Callback());
  a_->getServiceNameForReporterID(0, names.Callback());
  h_.Run();
  EXPECT_THAT(names.all(), ElementsAre(2, 65535, 65535, 65535));
  EXPECT_EQ(log_.Count(": returnning service type 2 for reporter  42"), 1);

  h_.Create(a_, 0);  // a session under ID 0 is allowed, and found by the second answer
  a_.Session(0)->setServiceType(3);  // (the protocol cannot type it: ID 0 is refused there)
  Replies<std::uint16_t> own;
  a_->getServiceNameForReporterID(0, own.Callback());
  h_.Run();
  EXPECT_THAT(own.all(), ElementsAre(65535, 3));
}

TEST_F(ServiceTest, StartHoldsItsReplyUntilStopAndANewStartDeliversTheOneItReplaces) {
  h_.Create(a_, 42, 2);
  std::vector<std::string> order;
  a_->startReportingSessionForID(42,
                                 [&](bool ok) { order.push_back(ok ? "start YES" : "start NO"); });
  h_.Run();
  auto session = a_.Session(42);
  EXPECT_TRUE(order.empty());
  EXPECT_TRUE(session->started());
  ASSERT_TRUE(session->driverSnapShot());  // empty without drivers, but present
  EXPECT_EQ(livo_.Sessions().size(), 1u);

  a_->stopReportingSessionForID(42, [&](bool ok) { order.push_back(ok ? "stop YES" : "stop NO"); });
  h_.Run();
  EXPECT_THAT(order, ElementsAre("start YES", "stop YES"));
  EXPECT_FALSE(session->started());
  EXPECT_FALSE(session->driverSnapShot());
  EXPECT_FALSE(session->transactionCompleteBlock());
  EXPECT_EQ(log_.Count(": nothing interesting to fetch from the drivers"), 1);
  EXPECT_EQ(log_.Count(": stopping 42"), 1);

  BoolReplies first = h_.Create(a_, 7, std::nullopt, true);
  a_.Session(7)->stop();  // stopped behind the handler's back: the reply stays pending
  EXPECT_TRUE(first.empty());
  BoolReplies second;
  a_->startReportingSessionForID(7, second.Callback());
  h_.Run();
  EXPECT_THAT(first.all(), ElementsAre(true));
  EXPECT_TRUE(second.empty());
  EXPECT_TRUE(a_.Session(7)->started());
}

TEST_F(ServiceTest, StartReachesAnotherClientsSessionButStopDoesNot) {
  h_.Create(a_, 42);
  BoolReplies startByB, stopByB, stopByA;
  b_->startReportingSessionForID(42, startByB.Callback());
  h_.Run();
  auto session = a_.Session(42);
  EXPECT_TRUE(session->started());
  b_->stopReportingSessionForID(42, stopByB.Callback());
  h_.Run();
  EXPECT_THAT(stopByB.all(), ElementsAre(true));
  EXPECT_TRUE(session->started());
  EXPECT_TRUE(startByB.empty());
  EXPECT_EQ(log_.Count(": stopping 42"), 1);  // logged although nothing was stopped

  a_->stopReportingSessionForID(42, stopByA.Callback());
  h_.Run();
  EXPECT_FALSE(session->started());
  EXPECT_THAT(startByB.all(), ElementsAre(true));  // B's reply travels with the session
}

TEST_F(ServiceTest, StartStopAndDestroyOfZeroOrUnknownIDsReplyAtOnce) {
  BoolReplies r;
  for (std::int64_t id : {0, 99}) {
    a_->startReportingSessionForID(id, r.Callback());
    a_->stopReportingSessionForID(id, r.Callback());
    a_->destroyReportingSession(id, r.Callback());
  }
  h_.Run();
  EXPECT_EQ(r.size(), 6u);
  EXPECT_EQ(log_.Count(": stopping 0") + log_.Count(": destroying 0"), 0);
  EXPECT_EQ(log_.Count(": stopping 99"), 1);
  EXPECT_EQ(log_.Count(": destroying 99"), 1);
  EXPECT_THAT(h_.env.trace->Codes(), ElementsAre(0x21042818u, 0x2104281Cu, 0x21042820u, 0x21042818u,
                                                 0x2104281Cu, 0x21042820u));
  EXPECT_TRUE(h_.env.trace->AllArgumentsZero());
}

TEST_F(ServiceTest, BroadcastReachesEveryStartedSessionAListSkipsZero) {
  h_.Create(a_, 1, 2, true);
  h_.Create(a_, 2, 2);
  h_.Create(b_, 3, 7, true);
  EXPECT_FALSE(h_.Send(b_, {{"k", "v"}}, 3, 1, std::nullopt));

  auto sessions = livo_.Sessions();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[0].messages.size(), 1u);
  EXPECT_EQ(sessions[1].messages.size(), 1u);
  EXPECT_TRUE(livo_.SingleMessages().empty());
  EXPECT_EQ(h_.env.analytics->EventsNamed("com.norvel.quenta.Playback.Start").size(), 2u);
  EXPECT_EQ(log_.Count(": sessions for client 100 : "), 1);
  EXPECT_EQ(log_.Count(": sessions for client 200 : "), 1);
  EXPECT_EQ(log_.Count(": active reporting sessions 2 : "), 1);

  // A list skips 0 even where the caller owns a started session 0, and unknown IDs: nothing
  // goes out, not even standalone.
  h_.Create(a_, 0);
  a_.Session(0)->start();
  EXPECT_FALSE(h_.Send(a_, {{"k", "v"}}, 3, 1, std::vector<std::int64_t>{0, 99}));
  EXPECT_EQ(livo_.AllSessionMessages().size(), 2u);
  EXPECT_TRUE(livo_.SingleMessages().empty());
}

TEST_F(ServiceTest, GetAllReportersListsClientByClientInMapOrder) {
  const std::pair<Client*, std::int64_t> creates[] = {
      {&a_, 3}, {&a_, 1}, {&a_, 3}, {&b_, 2}, {&b_, 3}};
  for (auto [c, id] : creates) h_.Create(*c, id);
  Replies<std::vector<std::int64_t>> r;
  b_->getAllReporters(r.Callback());  // replacing 3 kept its place
  a_->destroyReportingSession(3, BoolReplies().Callback());
  a_->getAllReporters(r.Callback());
  h_.Run();
  EXPECT_THAT(r.all(), ElementsAre(ElementsAre(3, 1, 2, 3), ElementsAre(1, 2, 3)));
}

// Beyond the limit per uid or in all, a create for a new ID makes no session (the reply is
// still YES): one error line, a refusal counted; replacing an ID still works, and a destroy
// frees a place.
TEST(SessionLimitTest, CreatesBeyondEitherLimitMakeNoSession) {
  const struct {
    std::size_t perUid, total;
    const char* line;
  } rows[] = {{3, 100, ": uid 1000 already holds 3 sessions, no session for reporter 4 of "},
              {100, 3,
               ": the clients hold 3 sessions, the most allowed; no session for reporter 4 of "
               "client 100"}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.line);
    ServiceHarness h(nullptr, {.maxSessionsPerUid = row.perUid, .maxSessions = row.total});
    const Counters& counters = *h.env.platform->counters;
    Client a = h.Connect(100);
    Client b = h.Connect(200, std::nullopt, 2000);
    BoolReplies r;
    for (std::int64_t id : {1, 2, 3, 4, 1}) a->createReportingSession(id, r.Callback());
    h.Run();
    EXPECT_THAT(r.all(), ElementsAre(true, true, true, true, true));
    EXPECT_EQ(a->clientReportingSessionMap().size(), 3u);
    EXPECT_EQ(h.env.log->Count(row.line), 1);
    h.Create(b, 9);  // another uid's place: its own, or none left in all
    EXPECT_EQ(b.Session(9) != nullptr, row.total > 3);
    a->destroyReportingSession(1, r.Callback());
    h.Create(b, 10);
    EXPECT_TRUE(b.Session(10));
    EXPECT_EQ(Counters::Get(counters.sessionsRefused), row.total > 3 ? 1u : 2u);
    EXPECT_EQ(Counters::Get(counters.sessionsOpen), row.total > 3 ? 4 : 3);
  }
}

// --- The delegate: connections ending ------------------------------------------------------

TEST_F(ServiceTest, EndBeforeListingLogsAMissingStartDate) {
  h_.env.process->SetName(300, "player");
  auto connection = std::make_shared<FakeIpcConnection>(300);
  h_.listener->Accept(connection);
  log_.Clear();
  connection->Invalidate();
  std::vector<std::string> texts;
  for (const auto& line : log_.Lines()) texts.push_back(line.text);
  EXPECT_THAT(texts, ElementsAre(EndsWith(": clientStartDate is nil. clientpid=300 "
                                          "clientprocessname=unknown"),
                                 EndsWith(": InvalidationHandler: connection exited process=(null) "
                                          "uptime_sec=-1"),
                                 EndsWith(": clientProcessName is nil. clientpid=300")));
  EXPECT_TRUE(h_.env.analytics->Events().empty());

  // The listing still runs first (the removal is queued behind it), then the removal.
  h_.Run();
  EXPECT_EQ(h_.delegate->clients().size(), 2u);  // a_ and b_ only
  EXPECT_EQ(log_.Count(": removing 300 from the server client list"), 1);
  EXPECT_EQ(log_.Count(": dealloc 300 from the server client list"), 1);
}

TEST_F(ServiceTest, InterruptionRemovesTheClientInvalidationOnlyReports) {
  Client a = h_.Connect(300, "player");
  h_.Create(a, 42, std::nullopt, true);
  auto session = a.Session(42);
  a.instance.reset();

  a.connection->Interrupt();
  EXPECT_EQ(log_.Count(": InterruptionHandler: connection exited"), 1);
  h_.Run();
  EXPECT_EQ(h_.delegate->clients().size(), 2u);  // a_ and b_ only
  EXPECT_FALSE(session->started());

  a.connection->Invalidate();
  h_.Run();
  EXPECT_EQ(log_.Count(": removing 300 from the server client list"), 1);
  EXPECT_EQ(h_.env.analytics->EventsNamed(kUptimeEvent).size(), 1u);
}

// --- Defaults and the reporting switch -----------------------------------------------------

TEST_F(ServiceTest, ANotificationReReadsTheSuiteAndPushesItToEverySession) {
  h_.Create(a_, 1);
  h_.Create(b_, 2, std::nullopt, true);
  h_.env.defaults->Set(kSuite, "device_name", "kitchen");
  h_.PostDefaults();
  auto defaults = h_.delegate->getDefaults();
  ASSERT_TRUE(defaults);
  EXPECT_EQ(*defaults, (Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));
  EXPECT_TRUE(h_.delegate->isReportingEnabled());
  for (auto session : {a_.Session(1), b_.Session(2)}) {
    EXPECT_EQ(*session->userInfo()->Find("device_name"), Value("kitchen"));
  }
  EXPECT_EQ(log_.Count(": re-reading quenta defaults"), 1);
  EXPECT_THAT(log_.Matching(": defaults {"), ElementsAre(HasSubstr("kitchen")));

  // A suite without "device_name" gives defaults without it.
  h_.env.defaults->Remove(kSuite, "device_name");
  h_.PostDefaults();
  EXPECT_EQ(*h_.delegate->getDefaults(), (Dictionary{{"disable_reporting", 0}}));
  EXPECT_NE(h_.delegate->getDefaults(), defaults);  // a fresh dictionary each time
}

TEST_F(ServiceTest, DisabledReportingRefusesSendsHidesOthers) {
  h_.Create(a_, 42, std::nullopt, true);
  h_.env.defaults->Set(kSuite, "disable_reporting", "YES");
  h_.PostDefaults();
  EXPECT_FALSE(h_.delegate->isReportingEnabled());
  for (auto ids : {std::optional<std::vector<std::int64_t>>{{42}},
                   std::optional<std::vector<std::int64_t>>{}}) {
    auto error = h_.Send(a_, {{"EngineOnTime", 1}}, 1, 6, ids);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, "com.norvel.audio.reporting");
    EXPECT_EQ(error->code, 1);
  }
  EXPECT_TRUE(h_.env.enerdex->Events().empty());
  EXPECT_TRUE(h_.env.analytics->Events().empty());
  EXPECT_TRUE(livo_.AllSessionMessages().empty());
  EXPECT_TRUE(livo_.SingleMessages().empty());

  // Cross-client lookups find nothing, even for the caller's own ID; own lookups still work.
  EXPECT_FALSE(h_.delegate->findReportingSessionForID(42, std::nullopt));
  Replies<Dictionary> valid;
  b_->reporterIDValid(42, valid.Callback());
  a_->reporterIDValid(42, valid.Callback());
  h_.Run();
  EXPECT_THAT(valid.all(), ElementsAre(Dictionary{{"reporterID", 0}, {"serviceType", 65535}},
                                       Dictionary{{"reporterID", 42}, {"serviceType", 65535}}));

  // Removing the value enables reporting again.
  h_.env.defaults->Remove(kSuite, "disable_reporting");
  h_.PostDefaults();
  EXPECT_TRUE(h_.delegate->isReportingEnabled());
  EXPECT_FALSE(h_.Send(a_, {{"EngineOnTime", 1}}, 1, 6, std::vector<std::int64_t>{42}));
  EXPECT_EQ(h_.env.enerdex->Events().size(), 1u);
}

TEST(DefaultsRegistrationTest, FailedRegistrationLeavesReportingOn) {
  ServiceHarness h([](FakePlatform& env) {
    env.notify->FailRegistrations(5);
    env.defaults->Set(kSuite, "disable_reporting", true);
  });
  EXPECT_EQ(h.env.log->Count(": notify setup result 5"), 1);
  h.PostDefaults();
  EXPECT_TRUE(h.delegate->isReportingEnabled());
  EXPECT_FALSE(h.delegate->getDefaults());
}

TEST(BridgesTest, StatlynUsesOriginWordsAndUndefinedNames) {
  FakePlatform env_;
  QNReportingStatlynBridge::handleEvent(*env_.platform, nullptr, 12, 7, nullptr);
  QNReportingStatlynBridge::handleEvent(*env_.platform, nullptr, 0x10000008, 1, nullptr);
  QNReportingStatlynBridge::handleEvent(*env_.platform, nullptr, 9, 0, nullptr);

  auto events = env_.analytics->Events();
  ASSERT_EQ(events.size(), 3u);
  EXPECT_EQ(events[0].name, "com.norvel.quenta.Undefined.Undefined");
  EXPECT_EQ(events[1].name, "com.norvel.quenta.DSP_Error.Start");
  EXPECT_EQ(events[2].name, "com.norvel.quenta.Ostreling.Generic");
  // No message and no session: the payload only names the unknown host application.
  EXPECT_EQ(events[0].payload, Value(Dictionary{{"HostApplicationDisplayID", "Unknown"}}));
  EXPECT_TRUE(env_.log->Lines().empty());
}

// The power-log bridge: haptics usage (EngineOnTime wins over a leaked hardware time in the
// same message), or leaked session info with optional clients; a missing timestamp is one
// error line on the default log, the rest is still written.
TEST(BridgesTest, EnerdexWritesHapticsUsageOrLeakedSessionInfo) {
  FakePlatform env_;
  auto session = QNReportingSession::initWithID(env_.platform, 42, Array{Value(1)});
  session->setConfiguration(Payload({{"HostApplicationDisplayID", "com.example.game"}}));
  const struct {
    Dictionary message;
    QNReportingSession* session;
    const char* name;
    Dictionary payload;
  } rows[] = {
      {{{"EngineOnTime", 12.5},
        {"qnreporting_timestamp", 1700000000},
        {"Haptic_Active_Hardware_Time_Seconds", 2}},
       session.get(),
       "Vistrel_Haptics",
       {{"EngineOnDuration", 12.5},
        {"ApplicationName", "com.example.game"},
        {"TimestampEnd", 1700000000}}},
      {{{"Haptic_Active_Hardware_Time_Seconds", 9.25},
        {"Active_Clients", Value(Array{"a", "b"})},
        {"other", 1}},
       nullptr,
       "LeakedHapticsSessionInfo",
       {{"Haptic_Active_Hardware_Time_Seconds", 9.25}, {"Active_Clients", Value(Array{"a", "b"})}}},
      {{{"Haptic_Active_Hardware_Time_Seconds", 4}},
       nullptr,
       "LeakedHapticsSessionInfo",
       {{"Haptic_Active_Hardware_Time_Seconds", 4}}},
      {{{"EngineOnTime", 3}},
       nullptr,
       "Vistrel_Haptics",
       {{"EngineOnDuration", 3}, {"ApplicationName", "Unknown"}}}};
  for (const auto& row : rows) {
    QNReportingEnerdexUtility::handleEvent(*env_.platform, &row.message, 0x0800000B, 6,
                                           row.session);
  }
  auto events = env_.enerdex->Events();
  ASSERT_EQ(events.size(), std::size(rows));
  for (std::size_t i = 0; i < events.size(); ++i) {
    EXPECT_EQ(events[i].subsystem, 28);
    EXPECT_EQ(events[i].name, rows[i].name);
    EXPECT_EQ(events[i].payload, Value(rows[i].payload));
    EXPECT_TRUE(events[i].options.is_null());
  }
  auto lines = env_.log->Lines();
  std::erase_if(lines, [](const auto& l) { return l.scope == "qnrr"; });  // the session's
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::kError);
  EXPECT_THAT(lines[0].text, ::testing::MatchesRegex("QNReportingEnerdexUtility\\.cpp:[0-9]+:.*: "
                                                     "failed to get QNReporting timestamp for "
                                                     "enerdex"));
}

using Throttle = QNReportingBlockThrottle;

std::string Key(const Dictionary& payload, std::int64_t id = 1, std::uint32_t category = 5,
                std::uint16_t type = 1) {
  return Throttle::buildMessageKey(payload, id, category, type);
}

// The key: payload parts in key order, masked values as "^", then reporter, category, type;
// then pairs of messages that are (not) duplicates.
TEST(MessageKeyTest, PartsInKeyOrderWithMaskedValuesAndDuplicates) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {Throttle::buildMessageKey(Dictionary{{"b", 2}, {"a", "x"}, {"systemuptime_sec", 812}}, 42, 5,
                                 1),
       "a|x|b|2|systemuptime_sec|^|reporterID|42|Setup|Start"},
      {Throttle::buildMessageKey(Dictionary{}, 7, 1, 0), "reporterID|7|Generic|Generic"},
      {Key(Dictionary{{"", "x"}}), "|x|reporterID|1|Setup|Start"},  // "" sorts first
      // Code-point order: upper case, then "_", then lower case.
      {Key(Dictionary{{"b", 1}, {"_x", 2}, {"A", 3}}), "A|3|_x|2|b|1|reporterID|1|Setup|Start"},
      {Key(Dictionary{{"a", 1}, {"_comparison_field_blacklist", Array{Value("a")}}}),
       "_comparison_field_blacklist|^|a|^|reporterID|1|Setup|Start"},
      // A skip list that is not an array is ignored.
      {Key(Dictionary{{"a", 1}, {"_comparison_field_blacklist", "a"}}),
       "_comparison_field_blacklist|^|a|1|reporterID|1|Setup|Start"},
      {Key(Dictionary{{"Volume", 0.5}, {"VolumeOperationTime", 3}, {"_throttle_seconds", 1}}),
       "Volume|^|VolumeOperationTime|^|_throttle_seconds|^|reporterID|1|Setup|Start"}};
  for (const auto& [key, expected] : cases) EXPECT_EQ(key, expected);
  const std::tuple<std::string, std::string, bool> pairs[] = {
      {Key(Dictionary{{"x", 1}, {"qnreporting_timestamp", 1}}),
       Key(Dictionary{{"x", 1}, {"qnreporting_timestamp", 2}}), true},
      {Key(Dictionary{{"Volume", 0.3}, {"VolumeOperationTime", 1}}),
       Key(Dictionary{{"Volume", 0.7}, {"VolumeOperationTime", 2}}), true},
      {Key(Dictionary{{"Volume", 0.3}}), Key(Dictionary{{"Volume", 0.7}}), false},
      {Key(Dictionary{{"x", 1}, {"processuptime_ms", 5}}), Key(Dictionary{{"x", 1}}), false},
      {Key(Dictionary{}, 1, 12), Key(Dictionary{}, 1, 13), true},  // both "Undefined"
      {Key(Dictionary{}, 1, 5, 6), Key(Dictionary{}, 1, 5, 65534), true},
      {Key(Dictionary{}, 1), Key(Dictionary{}, 2), false},
      {Key(Dictionary{{"", ""}}), Key(Dictionary{}), false}};
  for (const auto& [x, y, same] : pairs) EXPECT_EQ(x == y, same) << x << " / " << y;
}

TEST(ThrottleTimeTest, AcceptsIntegerPartUpToFourElseHalfASecondWithAnInfoLine) {
  // Each row: the payload's time (if any), the seconds, the info line's end ("" for none).
  const std::tuple<std::optional<Value>, double, std::string> cases[] = {
      {std::nullopt, 0.5, ""},
      {Value(4.99), static_cast<double>(4.99f), ""},
      {Value(-1), -1.0, ""},
      {Value(0), 0.0, ""},
      {Value(5), 0.5, ": Rejecting large throttle time. {time=5, max=5.000000}"},
      {Value("2"), 0.5, ": Rejecting non Valbox value of throttle time. {time=2}"}};
  for (const auto& [time, seconds, line] : cases) {
    LogCapture log;
    Dictionary payload;
    if (time) payload.Set("_throttle_seconds", *time);
    EXPECT_EQ(Throttle::determineSleepTime(payload, log), seconds);
    const auto lines = log.Lines();
    ASSERT_EQ(lines.size(), line.empty() ? 0u : 1u);
    for (const auto& l : lines)
      EXPECT_TRUE(l.level == LogLevel::kInfo && l.text.ends_with(line)) << l.text;
  }
}

class BlockThrottleTest : public ::testing::Test {
 protected:
  void SetUp() override { log_->EnableDebug("all"); }
  std::shared_ptr<LogCapture> log_ = std::make_shared<LogCapture>();
  Throttle throttle_{log_, nullptr};
};

// Two same-key messages 0.2 s apart with a delay well above that (wide margin); a duplicate
// with a shorter delay brings the action forward.
TEST_F(BlockThrottleTest, OnlyTheLastActionOfABurstRunsOnce) {
  std::atomic<int> first{0}, second{0}, other{0};
  std::promise<void> ran;
  const Dictionary message{{"a", 1}, {"_throttle_seconds", 1.5}};
  throttle_.addMessageBlock([&] { ++first; }, 1, message, 5, 1);
  throttle_.addMessageBlock([&] { ++first; }, 4, Dictionary{{"_throttle_seconds", 4}}, 5, 1);
  std::this_thread::sleep_for(std::chrono::milliseconds(200));
  const auto second_added = std::chrono::steady_clock::now();
  std::chrono::steady_clock::time_point second_ran, shortened_ran;
  throttle_.addMessageBlock([&] { shortened_ran = std::chrono::steady_clock::now(); }, 4,
                            Dictionary{{"_throttle_seconds", 0}}, 5, 1);
  throttle_.addMessageBlock(
      [&] {
        second_ran = std::chrono::steady_clock::now();
        ++second, ran.set_value();
      },
      1, message, 5, 1);
  throttle_.addMessageBlock([&] { ++other; }, 2, message, 5, 1);  // another reporter
  // An action that throws is logged, leaves no entry, and the throttle goes on.
  throttle_.addMessageBlock([] { throw std::runtime_error("boom"); }, 3,
                            Dictionary{{"_throttle_seconds", 0}}, 5, 1);
  ASSERT_EQ(ran.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  throttle_.waitForCompletion();
  EXPECT_EQ(first, 0);
  EXPECT_EQ(second, 1);
  EXPECT_GE(second_ran - second_added, std::chrono::milliseconds(1450));  // the delay restarted
  EXPECT_LT(shortened_ran - second_added, std::chrono::seconds(1));       // not at 4 s
  EXPECT_EQ(other, 1);
  EXPECT_EQ(
      log_->Count(
          ": Dropping duplicate message for _throttle_seconds|^|a|1|reporterID|1|Setup|Start"),
      1);
  EXPECT_EQ(throttle_.timersInFlightCount(), 0u);
  EXPECT_EQ(log_->Count(": throttled action failed: boom"), 1);
  // The queue thread's own debug lines.
  for (const char* text :
       {": calling workingRunLoop run from inside thread block", ": sleeping in thread"}) {
    const auto lines = log_->Lines();
    EXPECT_TRUE(std::any_of(lines.begin(), lines.end(), [text](const auto& line) {
      return line.level == LogLevel::kDebug && line.text.ends_with(text);
    })) << text;
  }
}

TEST_F(BlockThrottleTest, WaitForCompletionReturnsAtOnceOrGivesUpAfterFiveSeconds) {
  throttle_.waitForCompletion();
  auto lines = log_->Lines();  // no wait, no give-up line; the thread's own lines aside
  std::erase_if(lines,
                [](const auto& line) { return line.text.ends_with(": sleeping in thread"); });
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::kInfo);
  EXPECT_THAT(lines[0].text,
              EndsWith(": waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0"));

  // An action that outlasts the wait keeps its entry until it returns.
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  throttle_.addMessageBlock([released] { released.wait(); }, 1,
                            Dictionary{{"_throttle_seconds", 0}}, 5, 1);
  throttle_.waitForCompletion();
  release.set_value();
  EXPECT_EQ(log_->Count("Waiting up to 5 seconds for blockThrottle queue to be empty."), 1);
  const auto gave_up = log_->Matching("Giving up");
  ASSERT_EQ(gave_up.size(), 1u);
  EXPECT_THAT(gave_up[0],
              EndsWith(": Giving up on waiting for completion after 5 seconds. timersInFlight=1"));
}

}  // namespace
}  // namespace qn
