// Record, creation, configuration, service types, message identifiers, start and stop.
#include <chrono>

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
  EXPECT_EQ(*session->messageTypeCounts(),
            (Dictionary{{"Setup_Start", 3}, {"DSP_Error_Error", 1}, {"Undefined_Unknown", 1}}));
}

TEST_F(SessionTest, UnsetServiceTypeGivesUnknownSessionAndApiUsageFlags) {
  auto unset = NewSession(1);
  unset->start();
  auto api = NewSession(2);
  api->setServiceType(12);
  api->start();
  t_.dispatcher->RunUntilIdle();
  auto sessions = t_.livo->Sessions();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(*sessions[0].user_info.Find(kLivoReportingUserInfoServiceName),
            Value("unknown_session"));
  EXPECT_EQ(*sessions[0].session_info.Find(kLivoReportingSessionInfoBatchEvent), Value(true));
  EXPECT_EQ(*sessions[0].session_info.Find(kLivoReportingSessionInfoContainsRealtimeEvents),
            Value(false));
  EXPECT_EQ(*sessions[1].user_info.Find(kLivoReportingUserInfoServiceName),
            Value("apiusage_session"));
  EXPECT_EQ(*sessions[1].session_info.Find(kLivoReportingSessionInfoBatchEvent), Value(false));
  EXPECT_EQ(*sessions[1].session_info.Find(kLivoReportingSessionInfoContainsRealtimeEvents),
            Value(true));
  EXPECT_EQ(*sessions[1].session_info.Find(kLivoReportingSessionInfoSessionID), Value(2));
}

TEST_F(SessionTest, TestServiceTypeNeverGetsAFrameworkSessionNorSendsAnything) {
  auto session = StartedSession(11);
  session->sendMessage(Payload({{"k", 1}}), 1, 0, nullptr);
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(t_.livo->TokensMade(), 0);
  EXPECT_TRUE(session->started());
  // Still aggregates and summarises.
  EXPECT_EQ(session->aggregatedPayloadData()->Snapshot().size(), 1u);
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

TEST_F(SessionTest, BackendsNeverFoundHoldsDeliveriesThenDropsThem) {
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
  EXPECT_FALSE(t_.log->Contains("No valid LivoReportingSession"));
  EXPECT_FALSE(t_.log->Contains("failed to find backend"));

  t_.dispatcher->AdvanceBy(1ms);
  auto failed = t_.log->Matching("failed to find backend");
  ASSERT_EQ(failed.size(), 1u);
  auto nosession = t_.log->Matching("No valid LivoReportingSession");
  EXPECT_THAT(nosession, ElementsAre(MatchesRegex("QNReportingSession\\.cpp:[0-9]+:.*: No valid "
                                                  "LivoReportingSession"),
                                     HasSubstr("No valid LivoReportingSession")));
  for (const auto& line : t_.log->Lines()) {
    if (line.text.find("No valid") != std::string::npos) {
      EXPECT_EQ(line.level, LogLevel::kError);
    }
  }
  EXPECT_FALSE(session->livoReportingSession());
  EXPECT_FALSE(session->livoReportingSessionStarted());
  EXPECT_TRUE(session->started());
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());

  // A framework answer that comes after the time-out changes nothing.
  EXPECT_EQ(t_.livo->AnswerPending(Array{Value("late")}), 1);
  t_.dispatcher->RunUntilIdle();
  EXPECT_FALSE(session->livoReportingSession());
}

TEST_F(SessionTest, NoBackendsLogsAndTimesOut) {
  t_.livo->SetDiscovery(FakeLivoReporting::Discovery::kNoBackends);
  auto session = NewSession();
  session->start();
  t_.dispatcher->RunUntilIdle();
  EXPECT_THAT(t_.log->Matching("No backends"),
              ElementsAre(MatchesRegex(".*: No backends found, this session won't get sent "
                                       "to the server")));
  EXPECT_TRUE(t_.log->Contains("waiting for livoreportingd to find backends"));
  t_.dispatcher->AdvanceBy(9s);
  EXPECT_TRUE(t_.log->Contains("failed to find backend"));
  EXPECT_FALSE(session->livoReportingSession());
}

TEST_F(SessionTest, LateBackendsReleaseQueuedDeliveries) {
  t_.livo->SetDiscovery(FakeLivoReporting::Discovery::kLate, 2s);
  auto session = NewSession();
  session->start();
  session->sendMessage(Payload({{"n", 1}}), 3, 1, nullptr);
  t_.dispatcher->AdvanceBy(1999ms);
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());
  t_.dispatcher->AdvanceBy(1ms);
  ASSERT_EQ(t_.livo->AllSessionMessages().size(), 1u);
  EXPECT_EQ(t_.log->Count(": continuing"), 1);
  EXPECT_TRUE(session->livoReportingSession());
  // Later deliveries do not wait any more.
  session->sendMessage(Payload({{"n", 2}}), 3, 1, nullptr);
  t_.dispatcher->RunUntilIdle();
  EXPECT_EQ(t_.livo->AllSessionMessages().size(), 2u);
  t_.dispatcher->AdvanceBy(20s);
  EXPECT_FALSE(t_.log->Contains("failed to find backend"));
}

TEST_F(SessionTest, StopFlushesDropsAndClears) {
  t_.log->EnableDebug("qnrr");
  auto session = NewSession();
  session->start();
  t_.dispatcher->RunUntilIdle();
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
  // Nothing was aggregated: no summary event.
  EXPECT_FALSE(t_.log->Contains("sending summary event"));
  EXPECT_TRUE(t_.livo->AllSessionMessages().empty());
}

TEST_F(SessionTest, FlushErrorIsLogged) {
  t_.livo->FailFlushes(Error{"store", 5, "disk full"});
  auto session = NewSession();
  session->start();
  t_.dispatcher->RunUntilIdle();
  session->stop();
  t_.dispatcher->RunUntilIdle();
  EXPECT_THAT(t_.log->Matching("flush error"),
              ElementsAre(MatchesRegex(".*: flush error disk full")));
}

}  // namespace
}  // namespace qn
