// Message intake and delivery: through the framework session, as single messages, and the
// cases where a message is dropped.
#include <algorithm>
#include <chrono>
#include <regex>

#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using testing::Payload;
using namespace std::chrono_literals;
using DeliveryTest = testing::SessionFixture;

TEST_F(DeliveryTest, StartedSessionDeliversConvertedPayloadWithCategoryCut) {
  t_.log->EnableDebug("qnrr");
  auto session = StartedSession();
  std::vector<std::optional<Error>> replies;
  session->sendMessage(Payload({{"two words", 1}, {7, "x"}, {"plain", Dictionary{{"in ner", 1}}}}),
                       0x00010005, 2, [&](std::optional<Error> e) { replies.push_back(e); });
  // The reply comes at once, before delivery, without an error.
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_FALSE(replies[0]);
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());

  t_.dispatcher->RunUntilIdle();
  auto messages = t_.livo->AllSessionMessages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(messages[0].category, 5);
  EXPECT_EQ(messages[0].type, 2);
  Dictionary expected{{"two_words", 1}, {7, "x"}, {"plain", Dictionary{{"in ner", 1}}}};
  EXPECT_EQ(messages[0].payload, Value(expected));

  EXPECT_THAT(session->aggregatedPayloadData()->Snapshot(), ElementsAre(Value(expected)));
  EXPECT_THAT(session->nestedAggregatedPayloadData()->Snapshot(),
              ElementsAre(Value(Dictionary{{"_Setup_Stop_1", expected}})));
  EXPECT_EQ(t_.trace->Count(0x21042838), 1);
  EXPECT_EQ(t_.log->Count(": sending message for session owned by 42"), 1);
  // The success line prints the payload as the client sent it and the full category.
  auto agent = t_.log->Matching("LivoReportingAgent");
  ASSERT_EQ(agent.size(), 1u);
  EXPECT_THAT(agent[0], HasSubstr(": LivoReportingAgent <FakeLivoReportingSession 0> : message "));
  EXPECT_THAT(agent[0], HasSubstr("\"two words\" = 1;"));
  EXPECT_THAT(agent[0], HasSubstr(" : category 65541 : type 2"));
}

TEST_F(DeliveryTest, DeliveriesKeepSubmissionOrder) {
  auto session = StartedSession();
  for (int i = 0; i < 5; ++i) session->sendMessage(Payload({{"i", i}}), 1, 0, nullptr);
  t_.dispatcher->RunUntilIdle();
  auto messages = t_.livo->AllSessionMessages();
  ASSERT_EQ(messages.size(), 5u);
  for (int i = 0; i < 5; ++i) EXPECT_EQ(*messages[i].payload.as_dictionary()->Find("i"), Value(i));
}

TEST_F(DeliveryTest, MessageBeforeStartIsCountedDiscardedAndSentSingle) {
  t_.log->EnableDebug("qnrr");
  auto session = NewSession(42, 7);
  session->sendMessage(Payload({{"k v", 1}}), 0x00010005, 1, nullptr);
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().size(), 1u);
  session->start();
  EXPECT_TRUE(session->aggregatedPayloadData()->Snapshot().empty());
  EXPECT_TRUE(session->nestedAggregatedPayloadData()->Snapshot().empty());
  EXPECT_EQ(*session->messageTypeCounts(), (Dictionary{{"_Setup_Start", 1}}));
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
  // The single send is a message trace point of its own.
  EXPECT_EQ(t_.trace->Count(0x21042838), 2);
}

TEST_F(DeliveryTest, SingleMessageIgnoresUserInfoAndReportsFailures) {
  std::vector<std::optional<Error>> replies;
  auto reply = [&](std::optional<Error> e) { replies.push_back(e); };
  auto userInfo = Payload({{"device_name", "box"}});

  QNReportingSession::sendSingleMessage(t_.platform, Payload({{"x y", 1}}), 0xFFFFFFFF, 0xFFFF, 5,
                                        userInfo, reply);
  t_.dispatcher->RunUntilIdle();
  auto singles = t_.livo->SingleMessages();
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0].user_info,
            (Dictionary{{kLivoReportingUserInfoClientName, "com.norvel.quenta"},
                        {kLivoReportingUserInfoServiceName, "standalone"}}));
  EXPECT_EQ(singles[0].category, 0xFFFF);
  EXPECT_EQ(singles[0].payload, Value(Dictionary{{"x_y", 1}}));
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_FALSE(replies[0]);

  t_.livo->FailSingleSends(true, Error{"livo", 9, "no route"});
  QNReportingSession::sendSingleMessage(t_.platform, nullptr, 1, 0, 5, nullptr, reply);
  t_.dispatcher->RunUntilIdle();
  EXPECT_THAT(t_.log->Matching("sendOneMessageWithSessionInfo"),
              ElementsAre(MatchesRegex(
                  "QNReportingSession\\.cpp:[0-9]+:.*: sendOneMessageWithSessionInfo no route")));
  ASSERT_EQ(replies.size(), 2u);
  ASSERT_TRUE(replies[1]);
  EXPECT_EQ(replies[1]->description, "no route");

  t_.livo->FailSingleSends(true);
  QNReportingSession::sendSingleMessage(t_.platform, nullptr, 1, 0, 5, nullptr, reply);
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(t_.log->Count("sendOneMessageWithSessionInfo"), 1);
  ASSERT_EQ(replies.size(), 3u);
  EXPECT_FALSE(replies[2]);
}

TEST_F(DeliveryTest, AlarmSingleMessagesWaitTheirRandomDelay) {
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
    ASSERT_GE(seconds, 0);
    ASSERT_LE(seconds, 59);
    longest = std::max(longest, seconds);
    if (seconds > 0) {
      t_.dispatcher->AdvanceBy(std::chrono::seconds(seconds) - 1ms);
      EXPECT_EQ(t_.livo->SingleMessages().size(), before);
      t_.dispatcher->AdvanceBy(1ms);
    } else {
      t_.dispatcher->RunUntilIdle();
    }
    EXPECT_EQ(t_.livo->SingleMessages().size(), before + 1);
  }
  EXPECT_GT(longest, 0) << "the alarm delay was 0 in every round";
}

}  // namespace
}  // namespace qn
