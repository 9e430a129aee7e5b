// One session on fakes: identifiers, service types, the framework session's start with its
// backends wait, delivery (through the framework session or as single messages), stop; and
// the bounded wait.
#include <algorithm>
#include <chrono>
#include <regex>

#include "Statistics/QNReportingUtility.h"
#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using ::testing::ElementsAre;
using testing::FakeLivoReporting;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using testing::Payload;
using namespace std::chrono_literals;
using SessionTest = testing::SessionFixture;

TEST_F(SessionTest, MessageIdentifiersCountPerPair) {
  auto session = NewSession();
  EXPECT_EQ(session->messageIdForCategory(5, 1), "Setup_Start_1");
  EXPECT_EQ(session->messageIdForCategory(5, 1), "Setup_Start_2");
  EXPECT_EQ(session->messageIdForCategory(0x10000008, 4), "DSP_Error_Error_1");
  EXPECT_EQ(session->messageIdForCategory(0x00000005, 1), "Setup_Start_3");
  EXPECT_EQ(session->messageIdForCategory(0xFFFFFFFF, 0xFFFF), "Undefined_Unknown_1");
  EXPECT_EQ(session->messageTypeCounts(),
            (Dictionary{{"Setup_Start", 3}, {"DSP_Error_Error", 1}, {"Undefined_Unknown", 1}}));
}

TEST_F(SessionTest, ServiceTypeDecidesTheFrameworkSessionsNameAndFlags) {
  const struct {
    std::optional<std::uint16_t> serviceType;
    const char* name;
    bool batch;
  } rows[] = {{std::nullopt, "unknown_session", true}, {12, "apiusage_session", false}};
  for (const auto& row : rows) NewSession(2, row.serviceType)->start();
  t_.dispatcher->RunUntilIdle();
  auto sessions = t_.livo->Sessions();
  ASSERT_EQ(sessions.size(), 2u);
  for (std::size_t i = 0; i < 2; ++i) {
    const auto& s = sessions[i];
    EXPECT_EQ(*s.user_info.Find(kLivoReportingUserInfoServiceName), Value(rows[i].name));
    EXPECT_EQ(*s.session_info.Find(kLivoReportingSessionInfoBatchEvent), Value(rows[i].batch));
    EXPECT_EQ(*s.session_info.Find(kLivoReportingSessionInfoContainsRealtimeEvents),
              Value(!rows[i].batch));
    EXPECT_EQ(*s.session_info.Find(kLivoReportingSessionInfoSessionID), Value(2));
  }
}

TEST_F(SessionTest, TestServiceTypeNeverGetsAFrameworkSessionNorSendsAnything) {
  auto session = StartedSession(11);
  session->sendMessage(Payload({{"k", 1}}), 1, 0, nullptr);
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().size(), 1u);  // still aggregates
  session->stop();
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(t_.log->Count(": sending summary event for reporter 42"), 1);
  // One refusal for the message, one for the summary event.
  EXPECT_THAT(t_.log->Matching("transactions aren't allowed"),
              ElementsAre(MatchesRegex(".*: transactions aren't allowed on this platform"),
                          MatchesRegex(".*: transactions aren't allowed on this platform")));
  EXPECT_TRUE(t_.livo->Sessions().empty());
  EXPECT_TRUE(t_.livo->SingleMessages().empty());
}

// The wait for backends: 9 s, then the error lines, and queued deliveries dropped; a late
// answer changes nothing; an answer of no backends is logged and waits out the 9 s too.
TEST_F(SessionTest, TheWaitForBackendsHoldsDeliveries) {
  t_.livo->SetDiscovery(FakeLivoReporting::Discovery::kNever);
  auto session = NewSession();
  session->start();
  session->sendMessage(Payload({{"n", 1}}), 3, 1, nullptr);
  session->sendMessage(Payload({{"n", 2}}), 3, 2, nullptr);
  t_.dispatcher->RunUntilIdle();
  EXPECT_THAT(t_.log->Matching("waiting for livoreportingd"),
              ElementsAre(MatchesRegex("QNReportingUtility\\.cpp:[0-9]+:QNReportingUtilityWait: "
                                       "waiting for livoreportingd to find backends")));
  EXPECT_TRUE(session->livoReportingSession());  // pending

  t_.dispatcher->AdvanceBy(8999ms);
  EXPECT_FALSE(t_.log->Contains("failed to find backend"));
  t_.dispatcher->AdvanceBy(1ms);
  EXPECT_EQ(t_.log->Count("failed to find backend"), 1);
  EXPECT_THAT(t_.log->Matching("No valid LivoReportingSession"),
              ElementsAre(MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*: No valid "
                                       "LivoReportingSession"),
                          HasSubstr("No valid LivoReportingSession")));
  for (const auto& l : t_.log->Lines()) {
    EXPECT_TRUE(l.level == LogLevel::kError || l.text.find("No valid") == std::string::npos);
  }
  EXPECT_FALSE(session->livoReportingSession());
  EXPECT_FALSE(session->livoReportingSessionStarted());
  EXPECT_TRUE(session->started());
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());
  EXPECT_EQ(t_.livo->AnswerPending(Array{Value("late")}), 1);
  t_.dispatcher->RunUntilIdle();
  EXPECT_FALSE(session->livoReportingSession());

  t_.livo->SetDiscovery(FakeLivoReporting::Discovery::kNoBackends);
  auto none = NewSession(43);
  none->start();
  t_.dispatcher->RunUntilIdle();
  EXPECT_THAT(t_.log->Matching("No backends"),
              ElementsAre(MatchesRegex(".*: No backends found, this session won't get sent "
                                       "to the server")));
  t_.dispatcher->AdvanceBy(9s);
  EXPECT_EQ(t_.log->Count("failed to find backend"), 2);
  EXPECT_FALSE(none->livoReportingSession());

  // Backends found late release the queued deliveries; later ones do not wait.
  t_.livo->SetDiscovery(FakeLivoReporting::Discovery::kLate, 2s);
  auto late = NewSession(44);
  late->start();
  late->sendMessage(Payload({{"n", 1}}), 3, 1, nullptr);
  t_.dispatcher->AdvanceBy(1999ms);
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());
  t_.dispatcher->AdvanceBy(1ms);
  ASSERT_EQ(t_.livo->AllSessionMessages().size(), 1u);
  EXPECT_EQ(t_.log->Count(": continuing"), 1);
  late->sendMessage(Payload({{"n", 2}}), 3, 1, nullptr);  // no waiting any more
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(t_.livo->AllSessionMessages().size(), 2u);
  t_.dispatcher->AdvanceBy(20s);
  EXPECT_EQ(t_.log->Count("failed to find backend"), 2);
}

TEST_F(SessionTest, StopFlushesDropsAndClearsAndLogsAFlushError) {
  t_.log->EnableDebug("qnrr");
  t_.livo->FailFlushes(Error{"store", 5, "disk full"});
  auto session = StartedSession();
  session->stop();
  EXPECT_FALSE(session->started());
  EXPECT_FALSE(session->aggregatedPayloadData());
  EXPECT_FALSE(session->nestedAggregatedPayloadData());
  EXPECT_TRUE(session->livoReportingSession());  // dropped on the queue
  t_.dispatcher->RunUntilIdle();
  EXPECT_FALSE(session->livoReportingSession());
  ASSERT_EQ(t_.livo->Sessions().size(), 1u);
  EXPECT_EQ(t_.livo->Sessions()[0].flushes, 1);
  EXPECT_EQ(t_.trace->Count(0x21042830), 1);
  EXPECT_EQ(t_.log->Count(": ending session 42"), 2);
  EXPECT_THAT(t_.log->Matching("flush error"),
              ElementsAre(MatchesRegex(".*: flush error disk full")));
  // Nothing was aggregated: no summary event.
  EXPECT_FALSE(t_.log->Contains("sending summary event"));
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());
}

TEST_F(SessionTest, StartedSessionDeliversConvertedPayloadsInOrderWithCategoryCut) {
  t_.log->EnableDebug("qnrr");
  auto session = StartedSession();
  std::vector<std::optional<Error>> replies;
  session->sendMessage(Payload({{"two words", 1}, {7, "x"}, {"plain", Dictionary{{"in ner", 1}}}}),
                       0x00010005, 2, [&](std::optional<Error> e) { replies.push_back(e); });
  session->sendMessage(Payload({{"second", 2}}), 1, 0, nullptr);
  // The reply comes at once, before delivery, without an error.
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_FALSE(replies[0]);
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());

  t_.dispatcher->RunUntilIdle();
  auto messages = t_.livo->AllSessionMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[0].category, 5);
  EXPECT_EQ(messages[0].type, 2);
  Dictionary expected{{"two_words", 1}, {7, "x"}, {"plain", Dictionary{{"in ner", 1}}}};
  EXPECT_EQ(messages[0].payload, Value(expected));
  EXPECT_EQ(messages[1].payload, Value(Dictionary{{"second", 2}}));
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().front(), Value(expected));
  EXPECT_EQ(session->nestedAggregatedPayloadData()->Snapshot().front(),
            Value(Dictionary{{"_Setup_Stop_1", expected}}));
  EXPECT_EQ(t_.trace->Count(0x21042838), 2);
  EXPECT_EQ(t_.log->Count(": sending message for session owned by 42"), 2);
  // The success line prints the payload as the client sent it and the full category.
  auto agent = t_.log->Matching("LivoReportingAgent");
  ASSERT_EQ(agent.size(), 2u);
  EXPECT_THAT(agent[0], HasSubstr(": LivoReportingAgent <FakeLivoReportingSession 0> : message "));
  EXPECT_THAT(agent[0], HasSubstr("\"two words\" = 1;"));
  EXPECT_THAT(agent[0], HasSubstr(" : category 65541 : type 2"));
}

TEST_F(SessionTest, MessageBeforeStartIsCountedDiscardedAndSentSingle) {
  t_.log->EnableDebug("qnrr");
  auto session = NewSession(42, 7);
  session->sendMessage(Payload({{"k v", 1}}), 0x00010005, 1, nullptr);
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().size(), 1u);
  session->start();
  EXPECT_TRUE(session->aggregatedPayloadData()->Snapshot().empty());
  EXPECT_TRUE(session->nestedAggregatedPayloadData()->Snapshot().empty());
  EXPECT_EQ(session->messageTypeCounts(), (Dictionary{{"_Setup_Start", 1}}));
  t_.dispatcher->RunUntilIdle();

  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());
  auto singles = t_.livo->SingleMessages();
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0].session_info, (Dictionary{{kLivoReportingSessionInfoClientType, 19},
                                                 {kLivoReportingSessionInfoClientVersion, 2.0},
                                                 {kLivoReportingSessionInfoSessionID, -1}}));
  EXPECT_EQ(singles[0].user_info,
            (Dictionary{{kLivoReportingUserInfoClientName, "com.norvel.quenta"},
                        {kLivoReportingUserInfoServiceName, "longformaudio"}}));
  EXPECT_EQ(singles[0].category, 5);
  EXPECT_EQ(singles[0].type, 1);
  EXPECT_EQ(singles[0].payload, Value(Dictionary{{"k_v", 1}}));
  EXPECT_EQ(t_.log->Count(": session not started, will send as a single message"), 1);
  EXPECT_EQ(t_.log->Count(": sending single message after delta 0 for service 7"), 1);
  EXPECT_EQ(t_.log->Count(": sending single message"), 2);
  EXPECT_THAT(t_.log->Matching(": message {"),
              ElementsAre(MatchesRegex(".*: message \\{\n    k_v = 1;\n\\} : category 65541 : "
                                       "type 1")));
  EXPECT_EQ(t_.trace->Count(0x21042838), 2);  // the single send is a trace point of its own
}

// A standalone single message ignores the user info it is given; a failed send is logged
// and its error (if any) is the reply.
TEST_F(SessionTest, SingleMessageIgnoresUserInfoAndReportsFailures) {
  std::vector<std::optional<Error>> replies;
  auto send = [&](std::shared_ptr<const Dictionary> payload, std::uint32_t category) {
    QNReportingSession::sendSingleMessage(t_.platform, payload, category, 0xFFFF, 5,
                                          Payload({{"device_name", "box"}}),
                                          [&](std::optional<Error> e) { replies.push_back(e); });
    t_.dispatcher->RunUntilIdle();
  };
  send(Payload({{"x y", 1}}), 0xFFFFFFFF);
  auto singles = t_.livo->SingleMessages();
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0].user_info,
            (Dictionary{{kLivoReportingUserInfoClientName, "com.norvel.quenta"},
                        {kLivoReportingUserInfoServiceName, "standalone"}}));
  EXPECT_EQ(singles[0].category, 0xFFFF);
  EXPECT_EQ(singles[0].payload, Value(Dictionary{{"x_y", 1}}));

  t_.livo->FailSingleSends(true, Error{"livo", 9, "no route"});
  send(nullptr, 1);
  EXPECT_THAT(t_.log->Matching("sendOneMessageWithSessionInfo"),
              ElementsAre(MatchesRegex(
                  "QNReportingSession\\.cpp:[0-9]+:.*: sendOneMessageWithSessionInfo no route")));
  t_.livo->FailSingleSends(true);
  send(nullptr, 1);
  EXPECT_EQ(t_.log->Count("sendOneMessageWithSessionInfo"), 1);
  ASSERT_EQ(replies.size(), 3u);
  EXPECT_FALSE(replies[0]);
  EXPECT_EQ(replies[1].value_or(Error{}).description, "no route");
  EXPECT_FALSE(replies[2]);
}

TEST_F(SessionTest, AlarmSingleMessagesWaitTheirRandomDelay) {
  t_.log->EnableDebug("qnrr");
  const std::regex delta("after delta ([0-9]+) for service 4");
  // 20 draws from [0, 60): all of them 0 has a chance of 60^-20, so a delay that is always
  // 0 fails here.
  int longest = 0;
  for (int round = 0; round < 20; ++round) {
    t_.log->Clear();
    const std::size_t before = t_.livo->SingleMessages().size();
    QNReportingSession::sendSingleMessage(t_.platform, Payload({{"r", round}}), 1, 0, 4, nullptr,
                                          nullptr);
    auto lines = t_.log->Matching("after delta");
    ASSERT_EQ(lines.size(), 1u);
    std::smatch m;
    ASSERT_TRUE(std::regex_search(lines[0], m, delta)) << lines[0];
    const int seconds = std::stoi(m[1]);
    ASSERT_LE(seconds, 59);
    longest = std::max(longest, seconds);
    if (seconds > 0) {
      t_.dispatcher->AdvanceBy(std::chrono::seconds(seconds) - 1ms);
      EXPECT_EQ(t_.livo->SingleMessages().size(), before);
    }
    t_.dispatcher->AdvanceBy(1ms);
    EXPECT_EQ(t_.livo->SingleMessages().size(), before + 1);
  }
  EXPECT_GT(longest, 0) << "the alarm delay was 0 in every round";
}

// A wake-up without the flag set waits a full new period; the first deadline no longer
// counts; the time-out is an error line in the caller's scope.
TEST_F(SessionTest, WaitWokenWithoutItsFlagWaitsAFullNewPeriodThenTimesOut) {
  auto scope = t_.log->RegisterScope(true, 0x716E7272, "qnrr", "com.norvel.quenta",
                                     "reporting_session_verbose", 31);
  std::shared_ptr<Condition> condition = t_.dispatcher->CreateCondition();
  std::vector<bool> results;
  QNReportingUtilityWait(*t_.platform, condition, std::make_shared<bool>(false),
                         "waiting for the thing", "the thing never came", scope, 9.0,
                         [&](bool ok) { results.push_back(ok); });
  t_.dispatcher->AdvanceBy(5s);
  t_.dispatcher->WakeAllConditions();
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(t_.log->Count(": continuing"), 1);
  t_.dispatcher->AdvanceBy(8999ms);
  EXPECT_TRUE(results.empty());
  t_.dispatcher->AdvanceBy(1ms);
  EXPECT_THAT(results, ElementsAre(false));
  auto lines = t_.log->Lines();
  ASSERT_EQ(lines.size(), 4u);
  for (std::size_t i : {0, 2}) {
    EXPECT_THAT(lines[i].text, MatchesRegex("QNReportingUtility\\.cpp:[0-9]+:"
                                            "QNReportingUtilityWait: waiting for the thing"));
    EXPECT_EQ(lines[i].level, LogLevel::kDefault);
  }
  EXPECT_THAT(lines[3].text, MatchesRegex("QNReportingUtility\\.cpp:[0-9]+:"
                                          "QNReportingUtilityWait: the thing never came"));
  EXPECT_EQ(lines[3].level, LogLevel::kError);
  EXPECT_EQ(lines[3].scope, "qnrr");
}

}  // namespace
}  // namespace qn
