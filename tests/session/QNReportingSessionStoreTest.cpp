// A session end to end through the real SQLite reporting store and the Linux dispatcher:
// what the session hands the framework lands as rows of one framework session, in order.
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <future>

#include "Statistics/Service/QNReportingSession.h"
#include "common/Json.h"
#include "platform/linux/linux_dispatch.h"
#include "platform/linux/reporting_store.h"
#include "platform/linux/reporting_store_reader.h"
#include "platform/linux/store_sinks.h"
#include "tests/fakes/FakeDeviceInfo.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TraceRecorder.h"

namespace qn {
namespace {

class SessionStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/qn-session-store-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    dir_ = pattern;
    std::optional<Error> error;
    store_ = ReportingStore::Open(dir_ + "/reports.db", log_, &error);
    ASSERT_TRUE(store_) << (error ? error->Description() : "");
    auto platform = std::make_shared<Platform>();
    platform->log = log_;
    platform->trace = std::make_shared<testing::TraceRecorder>();
    platform->dispatcher = NewLinuxDispatcher();
    platform->device_info = std::make_shared<testing::FakeDeviceInfo>();
    platform->livo_reporting = NewStoreLivoReporting(store_);
    platform_ = platform;
  }

  void TearDown() override { std::filesystem::remove_all(dir_); }

  // Waits until everything queued on the session's queue so far has run.
  static void WaitForQueue(QNReportingSession& session) {
    std::promise<void> done;
    session.livoReportingQueue()->Async([&done] { done.set_value(); });
    done.get_future().wait();
  }

  std::vector<ReportingStoreRow> Rows() {
    std::optional<Error> error;
    auto reader = ReportingStoreReader::Open(dir_ + "/reports.db", &error);
    EXPECT_TRUE(reader) << (error ? error->Description() : "");
    std::vector<ReportingStoreRow> rows;
    if (reader) {
      reader->ForEachRow(ReportingSink::kReporting, [&](const ReportingStoreRow& row) {
        rows.push_back(row);
        return true;
      });
    }
    return rows;
  }

  static std::shared_ptr<const Dictionary> Payload(Dictionary d) {
    return std::make_shared<const Dictionary>(std::move(d));
  }

  std::string dir_;
  std::shared_ptr<testing::LogCapture> log_ = std::make_shared<testing::LogCapture>();
  std::shared_ptr<ReportingStore> store_;
  std::shared_ptr<const Platform> platform_;
};

TEST_F(SessionStoreTest, MessagesAndSummaryAreRowsOfOneFrameworkSessionInOrder) {
  auto session = QNReportingSession::initWithID(platform_, 42, Array{Value(1234)});
  ASSERT_TRUE(session);
  session->setServiceType(2);
  session->setConfiguration(Payload({{"HostApplicationDisplayID", "com.example.phone"}}));
  session->start();
  session->sendMessage(Payload({{"route", "speaker"}}), 5, 1, nullptr);
  session->sendMessage(Payload({{"route", "receiver"}, {"gain db", 3}}), 0x00010007, 2, nullptr);
  session->stop();
  WaitForQueue(*session);  // the end sequence has handed the flush over
  store_->Drain();

  std::vector<ReportingStoreRow> rows = Rows();
  ASSERT_EQ(rows.size(), 4u);
  const ReportingStoreRow& framework_session = rows[0];
  ASSERT_EQ(framework_session.table, ReportingStoreRow::Table::kLivoSession);
  EXPECT_TRUE(framework_session.flushed.has_value());
  Value user_info;
  ASSERT_FALSE(ParseJson(framework_session.user_info, user_info).has_value());
  EXPECT_EQ(*user_info.as_dictionary()->Find(kLivoReportingUserInfoServiceName),
            Value("telephony_session"));
  EXPECT_EQ(*user_info.as_dictionary()->Find("HostApplicationDisplayID"),
            Value("com.example.phone"));

  struct Expected {
    std::int64_t category, type;
    const char* payload;
  };
  const Expected expected[] = {
      {5, 1, R"({"route":"speaker"})"},
      {7, 2, R"({"route":"receiver","gain_db":3})"},  // low 16 bits; blank -> "_"
      {0xFFFF, 0xFFFF,
       R"({"QN_Session_Summary_Event":"2","route":"speaker,receiver","gain_db":"3"})"},
  };
  for (std::size_t i = 0; i < std::size(expected); ++i) {
    const ReportingStoreRow& row = rows[i + 1];
    SCOPED_TRACE(i);
    EXPECT_EQ(row.table, ReportingStoreRow::Table::kLivoMessage);
    EXPECT_EQ(row.session, framework_session.id);
    EXPECT_EQ(row.category, expected[i].category);
    EXPECT_EQ(row.type, expected[i].type);
    EXPECT_EQ(row.payload, expected[i].payload);
  }
}

TEST_F(SessionStoreTest, SingleMessageIsARowOfNoSessionWithItsOwnInfo) {
  std::promise<std::optional<Error>> sent;
  QNReportingSession::sendSingleMessage(platform_, Payload({{"b", 2}}), 0x00020001, 0, 3, nullptr,
                                        [&sent](std::optional<Error> e) { sent.set_value(e); });
  EXPECT_FALSE(sent.get_future().get().has_value());
  store_->Drain();

  std::vector<ReportingStoreRow> rows = Rows();
  ASSERT_EQ(rows.size(), 1u);
  for (const auto& row : rows) {
    EXPECT_EQ(row.table, ReportingStoreRow::Table::kLivoMessage);
    EXPECT_FALSE(row.session.has_value());
    EXPECT_EQ(row.category, 1);
    EXPECT_EQ(row.payload, R"({"b":2})");
    Value info;
    ASSERT_FALSE(ParseJson(row.user_info, info).has_value());
    EXPECT_EQ(*info.as_dictionary()->Find(kLivoReportingUserInfoServiceName), Value("haptics"));
    ASSERT_FALSE(ParseJson(row.session_info, info).has_value());
    EXPECT_EQ(*info.as_dictionary()->Find(kLivoReportingSessionInfoSessionID), Value(-1));
  }
}

}  // namespace
}  // namespace qn
