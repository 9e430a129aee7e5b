#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "Statistics/QNReportingEnerdexUtility.h"
#include "Statistics/QNReportingStatlynBridge.h"
#include "Statistics/Service/QNReportingSession.h"
#include "tests/fakes/FakePlatform.h"

namespace qn {
namespace {

using testing::FakePlatform;

class BridgesTest : public ::testing::Test {
 protected:
  // A session whose user info names its host application.
  std::shared_ptr<QNReportingSession> SessionOf(const std::string& host) {
    auto session = QNReportingSession::initWithID(env_.platform, 42, Array{Value(1)});
    Dictionary config{{"HostApplicationDisplayID", host}};
    session->setConfiguration(&config);
    return session;
  }

  FakePlatform env_;
};

// --- Analytics bridge ---------------------------------------------------------------------

TEST_F(BridgesTest, StatlynUsesOriginWordsAndUndefinedNames) {
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

// --- Power-log bridge ---------------------------------------------------------------------

TEST_F(BridgesTest, EnerdexWritesHapticsUsageWithAllFields) {
  auto session = SessionOf("com.example.game");
  // EngineOnTime wins over a leaked hardware time in the same message.
  Dictionary message{{"EngineOnTime", 12.5},
                     {"qnreporting_timestamp", 1700000000},
                     {"Haptic_Active_Hardware_Time_Seconds", 2}};
  QNReportingEnerdexUtility::handleEvent(*env_.platform, &message, 0x0800000B, 6, session.get());

  auto events = env_.enerdex->Events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].subsystem, 28);
  EXPECT_EQ(events[0].name, "Vistrel_Haptics");
  EXPECT_EQ(events[0].payload, Value(Dictionary{{"EngineOnDuration", 12.5},
                                                {"ApplicationName", "com.example.game"},
                                                {"TimestampEnd", 1700000000}}));
  EXPECT_TRUE(events[0].options.is_null());
  EXPECT_EQ(env_.log->Count("failed to get"), 0);
}

TEST_F(BridgesTest, EnerdexWithoutTimestampLogsOnceAndWritesTheRest) {
  Dictionary message{{"EngineOnTime", 3}};
  QNReportingEnerdexUtility::handleEvent(*env_.platform, &message, 1, 6, nullptr);

  auto events = env_.enerdex->Events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].payload,
            Value(Dictionary{{"EngineOnDuration", 3}, {"ApplicationName", "Unknown"}}));
  auto lines = env_.log->Lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::kError);
  EXPECT_EQ(lines[0].scope, "");
  EXPECT_NE(lines[0].text.find("QNReportingEnerdexUtility.cpp:"), std::string::npos);
  EXPECT_TRUE(lines[0].text.ends_with(": failed to get QNReporting timestamp for enerdex"));
}

TEST_F(BridgesTest, EnerdexWritesLeakedSessionInfoWithOptionalClients) {
  Dictionary withClients{{"Haptic_Active_Hardware_Time_Seconds", 9.25},
                         {"Active_Clients", Value(Array{"a", "b"})},
                         {"other", 1}};
  Dictionary alone{{"Haptic_Active_Hardware_Time_Seconds", 4}};
  QNReportingEnerdexUtility::handleEvent(*env_.platform, &withClients, 0, 6, nullptr);
  QNReportingEnerdexUtility::handleEvent(*env_.platform, &alone, 0, 6, nullptr);

  auto events = env_.enerdex->Events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].name, "LeakedHapticsSessionInfo");
  EXPECT_EQ(events[0].subsystem, 28);
  EXPECT_EQ(events[0].payload, Value(Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 9.25},
                                                {"Active_Clients", Value(Array{"a", "b"})}}));
  EXPECT_EQ(events[1].payload, Value(Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 4}}));
  EXPECT_TRUE(env_.log->Lines().empty());
}

}  // namespace
}  // namespace qn
