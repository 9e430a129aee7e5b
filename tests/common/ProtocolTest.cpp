#include "common/Protocol.h"

#include <gtest/gtest.h>

#include <string>

#include "common/MsgPack.h"

namespace qn::protocol {
namespace {

Value Request(std::initializer_list<Value> items) { return Value(Array(items)); }

RequestProblem MustFail(const Value& request) {
  auto result = ValidateRequest(request);
  if (auto* problem = std::get_if<RequestProblem>(&result)) return *problem;
  ADD_FAILURE() << "accepted: " << request.Description();
  return {};
}

RequestHeader MustPass(const Value& request) {
  auto result = ValidateRequest(request);
  if (auto* header = std::get_if<RequestHeader>(&result)) return *header;
  ADD_FAILURE() << "refused: " << std::get<RequestProblem>(result).message << " for "
                << request.Description();
  return {};
}

TEST(ProtocolTest, AcceptsWellFormedRequestsOfEveryOperation) {
  const Dictionary message{{"key", "value"}};
  struct Case {
    Value request;
    Op op;
  } cases[] = {
      {Request({1, 10, 42}), Op::kCreateReportingSession},
      {Request({2, 11, 65535, -42}), Op::kSetServiceType},
      {Request({3, 12, 0}), Op::kGetServiceNameForReporterID},
      {Request({4, 13, message, INT64_MAX}), Op::kSetConfiguration},
      {Request({5, 14, INT64_MIN}), Op::kStartReportingSession},
      {Request({6, 15, message, 4294967295LL, 0, Value()}), Op::kSendMessage},
      {Request({6, 16, Dictionary{}, 0, 65535, Array{1, -2, INT64_MAX}}), Op::kSendMessage},
      {Request({6, 17, message, 9, 0, Array{}}), Op::kSendMessage},
      {Request({7, 18, 1}), Op::kStopReportingSession},
      {Request({8, 19, 1}), Op::kDestroyReportingSession},
      {Request({9, 20, 1}), Op::kReporterIDValid},
      {Request({10, 21}), Op::kGetAllReporters},
      {Request({11, 4294967295LL}), Op::kKillService},
  };
  for (const auto& c : cases) {
    RequestHeader header = MustPass(c.request);
    EXPECT_EQ(header.op, c.op);
    EXPECT_EQ(header.request_id, *(*c.request.as_array())[1].as_uint64());
  }
}

TEST(ProtocolTest, RefusesRequestsThatAreNotOpAndId) {
  struct Case {
    Value request;
    ConnectionError code;
  } cases[] = {
      {Value(1), ConnectionError::kBadRequest},
      {Value(Dictionary{{"op", 1}}), ConnectionError::kBadRequest},
      {Request({}), ConnectionError::kBadRequest},
      {Request({1}), ConnectionError::kBadRequest},
      {Request({"create", 1, 42}), ConnectionError::kBadRequest},
      {Request({1.0, 1, 42}), ConnectionError::kBadRequest},
      {Request({true, 1, 42}), ConnectionError::kBadRequest},
      {Request({1, 0, 42}), ConnectionError::kBadRequest},
      {Request({1, -1, 42}), ConnectionError::kBadRequest},
      {Request({1, 4294967296LL, 42}), ConnectionError::kBadRequest},
      {Request({1, 2.0, 42}), ConnectionError::kBadRequest},
      {Request({1, Value(), 42}), ConnectionError::kBadRequest},
      {Request({0, 1, 42}), ConnectionError::kUnknownOp},
      {Request({12, 1}), ConnectionError::kUnknownOp},
      {Request({-1, 1}), ConnectionError::kUnknownOp},
      {Request({UINT64_MAX, 1}), ConnectionError::kUnknownOp},
  };
  for (const auto& c : cases) {
    RequestProblem problem = MustFail(c.request);
    EXPECT_EQ(problem.code, c.code) << c.request.Description() << ": " << problem.message;
    EXPECT_FALSE(problem.message.empty());
  }
}

TEST(ProtocolTest, RefusesWrongArgumentCounts) {
  for (const Value& request :
       {Request({1, 1}), Request({1, 1, 42, 43}), Request({2, 1, 5}), Request({10, 1, 0}),
        Request({11, 1, Value()}), Request({6, 1, Dictionary{}, 1, 1})}) {
    RequestProblem problem = MustFail(request);
    EXPECT_EQ(problem.code, ConnectionError::kBadArguments) << request.Description();
    EXPECT_NE(problem.message.find("takes"), std::string::npos) << problem.message;
  }
}

TEST(ProtocolTest, IntegersMustFitTheirKind) {
  const Dictionary d;
  struct Case {
    Value request;
    bool ok;
  } cases[] = {
      // service type: uint16
      {Request({2, 1, 0, 1}), true},
      {Request({2, 1, 65535, 1}), true},
      {Request({2, 1, 65536, 1}), false},
      {Request({2, 1, 70000, 1}), false},
      {Request({2, 1, -1, 1}), false},
      {Request({2, 1, 5.0, 1}), false},
      {Request({2, 1, true, 1}), false},
      {Request({2, 1, "5", 1}), false},
      // reporter ID: int64
      {Request({1, 1, INT64_MIN}), true},
      {Request({1, 1, INT64_MAX}), true},
      {Request({1, 1, static_cast<std::uint64_t>(INT64_MAX) + 1}), false},
      {Request({1, 1, UINT64_MAX}), false},
      {Request({1, 1, 42.0}), false},
      {Request({1, 1, Value()}), false},
      // category: uint32, type: uint16
      {Request({6, 1, d, 4294967295LL, 65535, Value()}), true},
      {Request({6, 1, d, 4294967296LL, 0, Value()}), false},
      {Request({6, 1, d, -1, 0, Value()}), false},
      {Request({6, 1, d, 0, 65536, Value()}), false},
      // message / configuration: a map
      {Request({6, 1, Array{}, 0, 0, Value()}), false},
      {Request({6, 1, Value(), 0, 0, Value()}), false},
      {Request({4, 1, "config", 1}), false},
      {Request({4, 1, Dictionary{{1, 2}}, 1}), true},
      // reporter ID list: nil or an array of int64
      {Request({6, 1, d, 0, 0, Array{1, -1, INT64_MIN}}), true},
      {Request({6, 1, d, 0, 0, Array{1, UINT64_MAX}}), false},
      {Request({6, 1, d, 0, 0, Array{1, "2"}}), false},
      {Request({6, 1, d, 0, 0, Array{1.5}}), false},
      {Request({6, 1, d, 0, 0, Array{Array{1}}}), false},
      {Request({6, 1, d, 0, 0, Dictionary{}}), false},
      {Request({6, 1, d, 0, 0, 7}), false},
  };
  for (const auto& c : cases) {
    auto result = ValidateRequest(c.request);
    EXPECT_EQ(std::holds_alternative<RequestHeader>(result), c.ok) << c.request.Description();
    if (auto* problem = std::get_if<RequestProblem>(&result)) {
      EXPECT_EQ(problem->code, ConnectionError::kBadArguments) << problem->message;
    }
  }
  RequestProblem problem = MustFail(Request({6, 9, d, 0, 0, Array{1, UINT64_MAX}}));
  EXPECT_EQ(problem.message,
            "argument 4 of sendMessage:withCategory:andType:forReportingIDs:reply: must be an "
            "array of signed 64-bit integers or nil, got an array (element 1 is "
            "18446744073709551615) (request 9)");
}

}  // namespace
}  // namespace qn::protocol
