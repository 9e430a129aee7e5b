// Reporting defaults, the defaults-change notification and the reporting switch.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "tests/service/ServiceHarness.h"

namespace qn {
namespace {

using testing::FakePlatform;
using ::testing::HasSubstr;
using testing::service::BoolReplies;
using testing::service::Client;
using testing::service::ErrorReplies;
using testing::service::Replies;
using testing::service::ServiceHarness;

constexpr const char* kSuite = "com.norvel.quenta";

class DefaultsTest : public ::testing::Test {
 protected:
  void Write(const std::string& key, Value value) {
    h_.env.defaults->Set(kSuite, key, std::move(value));
  }
  std::optional<Error> Send(const Client& c, std::optional<std::vector<std::int64_t>> ids) {
    ErrorReplies r;
    c->sendMessage(std::make_shared<const Dictionary>(Dictionary{{"EngineOnTime", 1}}), 1, 6,
                   std::move(ids), r.Callback());
    h_.Run();
    EXPECT_EQ(r.size(), 1u);
    return r.empty() ? std::nullopt : r[0];
  }

  ServiceHarness h_;
};

TEST_F(DefaultsTest, ANotificationReReadsTheSuiteAndPushesItToEverySession) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  BoolReplies r;
  a->createReportingSession(1, r.Callback());
  b->createReportingSession(2, r.Callback());
  b->startReportingSessionForID(2, r.Callback());
  h_.Run();

  Write("device_name", "kitchen");
  h_.PostDefaults();
  auto defaults = h_.delegate->getDefaults();
  ASSERT_TRUE(defaults);
  EXPECT_EQ(*defaults, (Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));
  EXPECT_TRUE(h_.delegate->isReportingEnabled());
  for (const Client* c : {&a, &b}) {
    for (const auto& entry : (*c)->clientReportingSessionMap()) {
      EXPECT_EQ(*entry.second->userInfo()->Find("device_name"), Value("kitchen"));
    }
  }
  EXPECT_EQ(h_.env.log->Count(": re-reading quenta defaults"), 1);
  auto lines = h_.env.log->Matching(": defaults {");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_THAT(lines[0], HasSubstr("kitchen"));

  // A suite without "device_name" gives defaults without it.
  h_.env.defaults->Remove(kSuite, "device_name");
  h_.PostDefaults();
  EXPECT_EQ(*h_.delegate->getDefaults(), (Dictionary{{"disable_reporting", 0}}));
  EXPECT_NE(h_.delegate->getDefaults(), defaults);  // a fresh dictionary each time
}

TEST_F(DefaultsTest, DisabledReportingRefusesSendsHidesOthers) {
  Client a = h_.Connect(100);
  Client b = h_.Connect(200);
  BoolReplies r;
  a->createReportingSession(42, r.Callback());
  a->startReportingSessionForID(42, r.Callback());
  h_.Run();

  Write("disable_reporting", "YES");
  h_.PostDefaults();
  EXPECT_FALSE(h_.delegate->isReportingEnabled());
  for (auto ids : {std::optional<std::vector<std::int64_t>>{{42}},
                   std::optional<std::vector<std::int64_t>>{}}) {
    auto error = Send(a, ids);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, "com.norvel.audio.reporting");
    EXPECT_EQ(error->code, 1);
  }
  EXPECT_TRUE(h_.env.enerdex->Events().empty());
  EXPECT_TRUE(h_.env.analytics->Events().empty());
  EXPECT_TRUE(h_.env.livo->AllSessionMessages().empty());
  EXPECT_TRUE(h_.env.livo->SingleMessages().empty());

  // Cross-client lookups find nothing, even for the caller's own ID; own lookups still work.
  EXPECT_FALSE(h_.delegate->findReportingSessionForID(42));
  Replies<Dictionary> valid;
  b->reporterIDValid(42, valid.Callback());
  a->reporterIDValid(42, valid.Callback());
  h_.Run();
  EXPECT_EQ(valid[0], (Dictionary{{"reporterID", 0}, {"serviceType", 65535}}));
  EXPECT_EQ(valid[1], (Dictionary{{"reporterID", 42}, {"serviceType", 65535}}));

  // Removing the value enables reporting again.
  h_.env.defaults->Remove(kSuite, "disable_reporting");
  h_.PostDefaults();
  EXPECT_TRUE(h_.delegate->isReportingEnabled());
  EXPECT_FALSE(Send(a, std::vector<std::int64_t>{42}));
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

}  // namespace
}  // namespace qn
