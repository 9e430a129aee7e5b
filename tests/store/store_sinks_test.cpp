#include "platform/linux/store_sinks.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <thread>

#include "common/Json.h"
#include "tests/fakes/FakeAnalytics.h"
#include "tests/fakes/FakeEnerdex.h"
#include "tests/store/store_test_util.h"

namespace qn {
namespace {

using testing::ParseJson;
using testing::ReadRows;
using Table = ReportingStoreRow::Table;

// ---- Analytics and power log: one contract, run on the store sinks and on the fakes ----

// What an event sink recorded: subsystem (0 for analytics), name, payload JSON.
struct RecordedEvent {
  std::int64_t subsystem = 0;
  std::string name;
  std::string payload;
  bool operator==(const RecordedEvent&) const = default;
};

void PrintTo(const RecordedEvent& e, std::ostream* os) {
  *os << "{" << e.subsystem << ", " << e.name << ", " << e.payload << "}";
}

struct StoreSinks {
  testing::TempDir dir;
  std::shared_ptr<ReportingStore> store =
      ReportingStore::Open(dir.File("reports.db"), nullptr, nullptr);
  std::shared_ptr<qn::Analytics> analytics = NewStoreAnalytics(store);
  std::shared_ptr<qn::Enerdex> enerdex = NewStoreEnerdex(store);

  std::vector<RecordedEvent> Recorded(ReportingSink sink) {
    store->Drain();
    std::vector<RecordedEvent> events;
    for (const auto& row : ReadRows(store->path(), sink)) {
      events.push_back({row.subsystem, row.name, row.payload});
    }
    return events;
  }
};

struct FakeSinks {
  std::shared_ptr<testing::FakeAnalytics> analytics = std::make_shared<testing::FakeAnalytics>();
  std::shared_ptr<testing::FakeEnerdex> enerdex = std::make_shared<testing::FakeEnerdex>();

  std::vector<RecordedEvent> Recorded(ReportingSink sink) {
    std::vector<RecordedEvent> events;
    if (sink == ReportingSink::kAnalytics) {
      for (const auto& e : analytics->Events()) {
        events.push_back({0, e.name, ToJsonLenient(e.payload)});
      }
    } else {
      for (const auto& e : enerdex->Events()) {
        events.push_back({e.subsystem, e.name, ToJsonLenient(e.payload)});
      }
    }
    return events;
  }
};

template <typename Sinks>
class EventSinkContractTest : public ::testing::Test {
 protected:
  Sinks sinks_;
};

using SinkKinds = ::testing::Types<StoreSinks, FakeSinks>;
TYPED_TEST_SUITE(EventSinkContractTest, SinkKinds);

TYPED_TEST(EventSinkContractTest, AnalyticsRecordsEachEventWithItsProvidersPayloadOnce) {
  std::atomic<int> calls{0};
  {
    // The payload lives only in the provider, as the analytics bridge hands it over.
    Value payload(Dictionary{{"HostApplicationDisplayID", "Unknown"}, {"volume", 0.5}});
    this->sinks_.analytics->SendEventLazy("com.norvel.quenta.Volume.Stop", [payload, &calls] {
      ++calls;
      return payload;
    });
  }
  this->sinks_.analytics->SendEventLazy("com.norvel.quenta.qnreportingclientuptime", [&calls] {
    ++calls;
    return Value(Dictionary{{"uptime", 12}});
  });
  this->sinks_.analytics->SendEventLazy("empty", nullptr);

  std::vector<RecordedEvent> expected = {
      {0, "com.norvel.quenta.Volume.Stop",
       R"({"HostApplicationDisplayID":"Unknown","volume":0.5})"},
      {0, "com.norvel.quenta.qnreportingclientuptime", R"({"uptime":12})"},
      {0, "empty", "null"},
  };
  EXPECT_EQ(this->sinks_.Recorded(ReportingSink::kAnalytics), expected);
  EXPECT_EQ(calls.load(), 2);
  EXPECT_TRUE(this->sinks_.Recorded(ReportingSink::kPowerLog).empty());
}

TYPED_TEST(EventSinkContractTest, PowerLogRecordsSubsystemNameAndPayloadInOrder) {
  this->sinks_.enerdex->LogRegisteredEvent(
      28, "Vistrel_Haptics",
      Value(Dictionary{{"EngineOnDuration", 1.5}, {"ApplicationName", "Unknown"}}), Value());
  this->sinks_.enerdex->LogRegisteredEvent(
      28, "LeakedHapticsSessionInfo", Value(Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 3}}),
      Value());
  std::vector<RecordedEvent> expected = {
      {28, "Vistrel_Haptics", R"({"EngineOnDuration":1.5,"ApplicationName":"Unknown"})"},
      {28, "LeakedHapticsSessionInfo", R"({"Haptic_Active_Hardware_Time_Seconds":3})"},
  };
  EXPECT_EQ(this->sinks_.Recorded(ReportingSink::kPowerLog), expected);
  EXPECT_TRUE(this->sinks_.Recorded(ReportingSink::kAnalytics).empty());
}

// ---- The store's sinks alone ----

class StoreSinksTest : public testing::StoreTest {
 protected:
  std::shared_ptr<ReportingStore> store_ = OpenStore();
};

TEST_F(StoreSinksTest, AnalyticsProviderRunsOffTheCallersThread) {
  auto analytics = NewStoreAnalytics(store_);
  std::thread::id provider_thread;
  analytics->SendEventLazy("e", [&] {
    provider_thread = std::this_thread::get_id();
    return Value();
  });
  store_->Drain();
  EXPECT_NE(provider_thread, std::thread::id());
  EXPECT_NE(provider_thread, std::this_thread::get_id());
}

// Discovery answers at once while the store is open, however far behind its writer is (a
// session start must not wait for the disk), and from another thread once it is closed.
TEST_F(StoreSinksTest, LivoReportingDiscoveryAnswersAtOnceWhileTheStoreIsOpen) {
  auto livo = NewStoreLivoReporting(store_, StoreLivoReportingOptions{std::nullopt});
  auto session = livo->CreateSession(Dictionary{}, Dictionary{}, Array{});
  bool answered = false;
  session->StartConfiguration([&](std::optional<Array> found) {
    EXPECT_FALSE(found);
    answered = true;
  });
  EXPECT_TRUE(answered);

  store_->Close();
  std::promise<std::thread::id> handler_thread;
  session->StartConfiguration(
      [&](std::optional<Array>) { handler_thread.set_value(std::this_thread::get_id()); });
  EXPECT_NE(handler_thread.get_future().get(), std::this_thread::get_id());
}

TEST_F(StoreSinksTest, LivoReportingSingleMessagesCarryTheirOwnSessionAndUserInfo) {
  auto livo = NewStoreLivoReporting(store_);
  Dictionary session_info{{kLivoReportingSessionInfoClientType, 19},
                          {kLivoReportingSessionInfoClientVersion, 2.0},
                          {kLivoReportingSessionInfoSessionID, -1}};
  Dictionary user_info{{kLivoReportingUserInfoClientName, "com.norvel.quenta"},
                       {kLivoReportingUserInfoServiceName, "standalone"}};
  std::optional<Error> error;
  EXPECT_TRUE(livo->SendOneMessage(session_info, user_info, 5, 3,
                                   Value(Dictionary{{"some_key", 1}}), &error));
  EXPECT_FALSE(error);
  store_->Drain();
  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0].table, Table::kLivoMessage);
  EXPECT_FALSE(rows[0].session);
  EXPECT_EQ(rows[0].category, 5);
  EXPECT_EQ(rows[0].type, 3);
  EXPECT_EQ(rows[0].payload, R"({"some_key":1})");
  EXPECT_EQ(rows[0].session_info, R"({"ClientType":19,"ClientVersion":2.0,"SessionID":-1})");
  EXPECT_EQ(rows[0].user_info, R"({"ClientName":"com.norvel.quenta","ServiceName":"standalone"})");
}

TEST_F(StoreSinksTest, LivoReportingClosedStoreRefusesMessagesWithAnErrorAndStillAnswersFlushes) {
  auto livo = NewStoreLivoReporting(store_);
  auto session = livo->CreateSession(Dictionary{}, Dictionary{}, Array{});
  store_->Close();

  std::optional<Error> error;
  EXPECT_FALSE(session->SendMessage(1, 1, Value(Dictionary{}), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, kReportingStoreErrorDomain);
  error.reset();
  EXPECT_FALSE(livo->SendOneMessage(Dictionary{}, Dictionary{}, 1, 1, Value(), &error));
  EXPECT_TRUE(error);
  EXPECT_FALSE(session->SendMessage(1, 1, Value(), nullptr));  // no error slot: no crash

  std::promise<std::optional<Error>> flushed;
  session->FlushMessages([&](std::optional<Error> e) { flushed.set_value(e); });
  EXPECT_TRUE(flushed.get_future().get());

  std::promise<bool> answered;
  session->StartConfiguration(
      [&](std::optional<Array> found) { answered.set_value(found.has_value()); });
  EXPECT_TRUE(answered.get_future().get());

  auto rows = ReadRows(db_path_);
  ASSERT_EQ(rows.size(), 1u);  // the session row handed over before the close
}

}  // namespace
}  // namespace qn
