// MakeExportedObject: checked wire arguments -> typed calls, typed replies -> wire values.

#include <gtest/gtest.h>

#include "Statistics/Service/QNReportingServiceProtocol.h"

namespace qn {
namespace {

using protocol::Op;

// Records each call's arguments and answers with the values the test set.
class RecordingService : public QNReportingServiceProtocol {
 public:
  std::vector<std::string> calls;
  std::int64_t reporter = 0;
  std::uint16_t service_type_arg = 0;
  std::uint32_t category = 0;
  std::uint16_t type = 0;
  MessagePayload payload;
  std::optional<std::vector<std::int64_t>> ids;

  bool bool_answer = true;
  std::uint16_t service_type_answer = 65535;
  Dictionary dictionary_answer;
  std::vector<std::int64_t> ids_answer;
  std::optional<Error> error_answer;
  BoolReply kill_reply;

  void createReportingSession(std::int64_t id, BoolReply reply) override {
    Record("create", id);
    reply(bool_answer);
  }
  void setServiceType(std::uint16_t serviceType, std::int64_t id, BoolReply reply) override {
    Record("type", id);
    service_type_arg = serviceType;
    reply(bool_answer);
  }
  void getServiceNameForReporterID(std::int64_t id, ServiceTypeReply reply) override {
    Record("name", id);
    reply(service_type_answer);
  }
  void setConfiguration(MessagePayload configuration, std::int64_t id, BoolReply reply) override {
    Record("config", id);
    payload = std::move(configuration);
    reply(bool_answer);
  }
  void startReportingSessionForID(std::int64_t id, BoolReply reply) override {
    Record("start", id);
    reply(bool_answer);
  }
  void sendMessage(MessagePayload message, std::uint32_t c, std::uint16_t t,
                   std::optional<std::vector<std::int64_t>> reporterIDs,
                   ErrorReply reply) override {
    calls.push_back("send");
    payload = std::move(message);
    category = c;
    type = t;
    ids = std::move(reporterIDs);
    reply(error_answer);
  }
  void stopReportingSessionForID(std::int64_t id, BoolReply reply) override {
    Record("stop", id);
    reply(bool_answer);
  }
  void destroyReportingSession(std::int64_t id, BoolReply reply) override {
    Record("destroy", id);
    reply(bool_answer);
  }
  void reporterIDValid(std::int64_t id, DictionaryReply reply) override {
    Record("valid", id);
    reply(dictionary_answer);
  }
  void getAllReporters(ReporterIDsReply reply) override {
    calls.push_back("reporters");
    reply(ids_answer);
  }
  void killService(BoolReply reply) override {
    calls.push_back("kill");
    kill_reply = std::move(reply);
  }

 private:
  void Record(const char* name, std::int64_t id) {
    calls.push_back(name);
    reporter = id;
  }
};

class ExportedObjectTest : public ::testing::Test {
 protected:
  // Runs one request and returns every reply value it produced.
  std::vector<Value> Run(Op op, Array args) {
    std::vector<Value> replies;
    object_->HandleRequest(op, args, [&](Value v) { replies.push_back(std::move(v)); });
    return replies;
  }

  std::shared_ptr<RecordingService> service_ = std::make_shared<RecordingService>();
  std::shared_ptr<IpcExportedObject> object_ = MakeExportedObject(service_);
};

TEST_F(ExportedObjectTest, BoolOperationsPassTheReporterIDAndReplyWithABool) {
  const std::vector<std::pair<Op, std::string>> ops = {
      {Op::kCreateReportingSession, "create"},
      {Op::kStartReportingSession, "start"},
      {Op::kStopReportingSession, "stop"},
      {Op::kDestroyReportingSession, "destroy"},
  };
  for (const auto& [op, name] : ops) {
    service_->bool_answer = name != "stop";
    EXPECT_EQ(Run(op, {Value(INT64_MIN)}), (std::vector<Value>{Value(name != "stop")})) << name;
    EXPECT_EQ(service_->calls.back(), name);
    EXPECT_EQ(service_->reporter, INT64_MIN);
  }
}

TEST_F(ExportedObjectTest, SetServiceTypeTakesTypeThenID) {
  EXPECT_EQ(Run(Op::kSetServiceType, {Value(65535), Value(-3)}), (std::vector<Value>{true}));
  EXPECT_EQ(service_->service_type_arg, 65535);
  EXPECT_EQ(service_->reporter, -3);
}

TEST_F(ExportedObjectTest, ServiceNameRepliesWithTheNumber) {
  service_->service_type_answer = 40000;
  auto replies = Run(Op::kGetServiceNameForReporterID, {Value(9)});
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0].as_uint64(), 40000u);
  EXPECT_EQ(service_->reporter, 9);
}

TEST_F(ExportedObjectTest, ConfigurationIsHandedOverWithoutACopy) {
  Value configuration(Dictionary{{"a", 1}, {"nested", Dictionary{{"b", "c"}}}});
  EXPECT_EQ(Run(Op::kSetConfiguration, {configuration, Value(12)}), (std::vector<Value>{true}));
  EXPECT_EQ(service_->payload.get(), configuration.shared_dictionary().get());
  EXPECT_EQ(service_->reporter, 12);
}

TEST_F(ExportedObjectTest, SendMessageArgumentsAndIDList) {
  Value message(Dictionary{{"route", "speaker"}});
  EXPECT_EQ(Run(Op::kSendMessage,
                {message, Value(std::uint32_t{0xFFFFFFFF}), Value(65535), Value(Array{-1, 0, 7})}),
            (std::vector<Value>{Value()}));
  EXPECT_EQ(service_->payload.get(), message.shared_dictionary().get());
  EXPECT_EQ(service_->category, 0xFFFFFFFFu);
  EXPECT_EQ(service_->type, 65535);
  EXPECT_EQ(service_->ids, (std::vector<std::int64_t>{-1, 0, 7}));

  Run(Op::kSendMessage, {message, Value(1), Value(2), Value()});
  EXPECT_FALSE(service_->ids.has_value()) << "nil means every session";
  Run(Op::kSendMessage, {message, Value(1), Value(2), Value(Array{})});
  EXPECT_EQ(service_->ids, std::vector<std::int64_t>{}) << "an empty list is not nil";
}

TEST_F(ExportedObjectTest, SendMessageErrorGoesOnTheWireAsAMap) {
  service_->error_answer = Error{"com.norvel.audio.reporting", 1, "reporting is disabled"};
  auto replies = Run(Op::kSendMessage, {Value(Dictionary{}), Value(1), Value(2), Value()});
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0],
            Value(Dictionary{
                {"domain", "com.norvel.audio.reporting"}, {"code", 1}, {"userInfo", Value()}}));
  const Dictionary* wire = replies[0].as_dictionary();
  ASSERT_TRUE(wire && wire->Find("userInfo"));
  EXPECT_TRUE(wire->Find("userInfo")->is_null());
  EXPECT_TRUE(ErrorToWire(std::nullopt).is_null());
}

TEST_F(ExportedObjectTest, ReporterIDValidRepliesWithTheDictionary) {
  service_->dictionary_answer = Dictionary{{"reporterID", 0}, {"serviceType", 65535}};
  EXPECT_EQ(Run(Op::kReporterIDValid, {Value(5)}),
            (std::vector<Value>{Value(Dictionary{{"reporterID", 0}, {"serviceType", 65535}})}));
  EXPECT_EQ(service_->reporter, 5);
}

TEST_F(ExportedObjectTest, GetAllReportersRepliesWithAnArrayInOrder) {
  service_->ids_answer = {3, -1, 3, INT64_MAX};
  EXPECT_EQ(Run(Op::kGetAllReporters, {}), (std::vector<Value>{Value(Array{3, -1, 3, INT64_MAX})}));
}

TEST_F(ExportedObjectTest, KillServiceGetsAReplyButNothingIsSent) {
  EXPECT_TRUE(Run(Op::kKillService, {}).empty());
  EXPECT_EQ(service_->calls.back(), "kill");
  EXPECT_TRUE(static_cast<bool>(service_->kill_reply));
}

TEST_F(ExportedObjectTest, ReplyCanBeCalledLaterAndTwice) {
  // The service may keep a reply and call it from another thread later; each call makes
  // a wire reply.
  struct Keeper final : RecordingService {
    ServiceTypeReply kept;
    void getServiceNameForReporterID(std::int64_t, ServiceTypeReply reply) override {
      kept = std::move(reply);
    }
  };
  auto keeper = std::make_shared<Keeper>();
  auto object = MakeExportedObject(keeper);
  std::vector<Value> replies;
  object->HandleRequest(Op::kGetServiceNameForReporterID, {Value(0)},
                        [&](Value v) { replies.push_back(std::move(v)); });
  EXPECT_TRUE(replies.empty());
  std::thread([&] {
    keeper->kept(65535);
    keeper->kept(2);
  }).join();
  EXPECT_EQ(replies, (std::vector<Value>{Value(65535), Value(2)}));
}

}  // namespace
}  // namespace qn
