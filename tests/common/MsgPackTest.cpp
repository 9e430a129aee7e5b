#include "common/MsgPack.h"

#include <gtest/gtest.h>

#include <cmath>
#include <ctime>
#include <limits>
#include <msgpack.hpp>
#include <string>

namespace qn {
namespace {

using protocol::ConnectionError;
using protocol::RequestProblem;

std::string Bytes(std::initializer_list<int> bytes) {
  std::string out;
  for (int b : bytes) out.push_back(static_cast<char>(b));
  return out;
}

std::string Hex(std::string_view bytes) {
  static const char* kHex = "0123456789abcdef";
  std::string out;
  for (unsigned char c : bytes) {
    out += kHex[c >> 4];
    out += kHex[c & 15];
  }
  return out;
}

Value MustDecode(std::string_view body) {
  auto result = DecodeMsgPack(body);
  if (auto* problem = std::get_if<RequestProblem>(&result)) {
    ADD_FAILURE() << "decode failed: " << problem->message << " for " << Hex(body);
    return Value();
  }
  return std::get<Value>(std::move(result));
}

RequestProblem MustFail(std::string_view body) {
  auto result = DecodeMsgPack(body);
  if (auto* problem = std::get_if<RequestProblem>(&result)) return *problem;
  ADD_FAILURE() << "decode of " << Hex(body.substr(0, 64))
                << " succeeded: " << std::get<Value>(result).Description();
  return RequestProblem{};
}

// A value of every kind, nested, with keys of several kinds.
Value EveryKind() {
  Dictionary inner{{"s", "text"}, {1, 2.5}, {Value(Array{1, 2}), Value(true)}};
  Dictionary outer;
  outer.Set("null", Value());
  outer.Set("bools", Array{true, false});
  outer.Set("ints", Array{0, -1, 127, 128, -33, 65536, INT64_MIN, INT64_MAX, UINT64_MAX});
  outer.Set("double", 0.1);
  outer.Set("data", Data{{0, 1, 0xff}});
  outer.Set("date", Date{1705329005.0});
  outer.Set("nested", inner);
  outer.Set(42, "number key");
  return Value(outer);
}

TEST(MsgPackTest, EveryTruncationFails) {
  std::string whole = EncodeMsgPack(Value(Array{EveryKind(), Date{1705329005.25}, Date{-3}}));
  ASSERT_TRUE(std::holds_alternative<Value>(DecodeMsgPack(whole)));
  for (std::size_t n = 0; n < whole.size(); ++n) {
    RequestProblem problem = MustFail(std::string_view(whole).substr(0, n));
    EXPECT_EQ(problem.code, ConnectionError::kBadMessagePack) << "prefix " << n;
  }
}

TEST(MsgPackTest, MalformedInputsAreRejected) {
  struct Case {
    const char* what;
    std::string body;
    ConnectionError code;
    const char* message_part;
  } cases[] = {
      {"empty body", "", ConnectionError::kBadMessagePack, "at byte 0"},
      {"reserved byte", Bytes({0xc1}), ConnectionError::kBadMessagePack, "0xc1"},
      {"reserved byte inside an array", Bytes({0x92, 0x01, 0xc1}), ConnectionError::kBadMessagePack,
       "at byte 2"},
      {"trailing garbage", Bytes({0xc0, 0x00}), ConnectionError::kBadMessagePack, "trailing"},
      {"array32 claiming 4 billion elements", Bytes({0xdd, 0xff, 0xff, 0xff, 0xff, 0xc0}),
       ConnectionError::kBadMessagePack, "4294967295 elements"},
      {"map32 claiming 4 billion entries", Bytes({0xdf, 0xff, 0xff, 0xff, 0xff, 0xc0}),
       ConnectionError::kBadMessagePack, "4294967295 entries"},
      {"map16 claiming more entries than bytes allow", Bytes({0xde, 0x00, 0x02, 0x01, 0x02, 0x03}),
       ConnectionError::kBadMessagePack, "map of 2 entries"},
      {"array16 claiming 65535 elements", Bytes({0xdc, 0xff, 0xff, 0xc0, 0xc0}),
       ConnectionError::kBadMessagePack, "65535 elements"},
      {"str32 claiming 4 GiB", Bytes({0xdb, 0xff, 0xff, 0xff, 0xff, 'x'}),
       ConnectionError::kBadMessagePack, "string of 4294967295 bytes"},
      {"bin32 claiming 4 GiB", Bytes({0xc6, 0xff, 0xff, 0xff, 0xff, 'x'}),
       ConnectionError::kBadMessagePack, "binary of 4294967295 bytes"},
      {"ext32 claiming 4 GiB", Bytes({0xc9, 0xff, 0xff, 0xff, 0xff, 0xff, 'x'}),
       ConnectionError::kBadMessagePack, "extension of 4294967295 bytes"},
      {"fixstr longer than the body", Bytes({0xa5, 'a', 'b'}), ConnectionError::kBadMessagePack,
       "string of 5 bytes"},
      {"unsupported extension", Bytes({0xd4, 0x05, 0x00}), ConnectionError::kBadMessagePack,
       "extension type 5"},
      {"timestamp of a wrong size", Bytes({0xd5, 0xff, 0x00, 0x00}),
       ConnectionError::kBadMessagePack, "timestamp of 2 bytes"},
      {"timestamp64 with 10^9 nanoseconds",
       Bytes({0xd7, 0xff, 0xee, 0x6b, 0x28, 0x00, 0x00, 0x00, 0x00, 0x00}),
       ConnectionError::kBadMessagePack, "nanoseconds"},
      {"truncated uint64", Bytes({0xcf, 0x01, 0x02}), ConnectionError::kBadMessagePack,
       "uint64 needs 8 bytes, 2 left"},
  };
  for (const auto& c : cases) {
    RequestProblem problem = MustFail(c.body);
    EXPECT_EQ(problem.code, c.code) << c.what;
    EXPECT_NE(problem.message.find(c.message_part), std::string::npos)
        << c.what << ": " << problem.message;
  }
}

std::string NestedArrays(int depth) {
  std::string body(static_cast<std::size_t>(depth), static_cast<char>(0x91));
  body.push_back(static_cast<char>(0xc0));
  return body;
}

std::string NestedMaps(int depth) {
  std::string body;
  for (int i = 0; i < depth; ++i) body += Bytes({0x81, 0x00});
  body.push_back(static_cast<char>(0xc0));
  return body;
}

TEST(MsgPackTest, NestingIsLimitedTo64Levels) {
  EXPECT_TRUE(MustDecode(NestedArrays(64)).is_array());
  EXPECT_TRUE(MustDecode(NestedMaps(64)).is_dictionary());
  for (const std::string& body :
       {NestedArrays(65), NestedMaps(65), NestedArrays(1000), NestedArrays(100000)}) {
    RequestProblem problem = MustFail(body);
    EXPECT_EQ(problem.code, ConnectionError::kTooDeep) << problem.message;
  }
  EXPECT_EQ(MustFail(NestedArrays(65)).message,
            "MessagePack too deep at byte 64: more than 64 levels of arrays and maps");
  // Depth counts map keys too: a 64-deep array used as a key one level down.
  std::string key_too_deep = Bytes({0x81}) + NestedArrays(64) + Bytes({0xc0});
  EXPECT_EQ(MustFail(key_too_deep).code, ConnectionError::kTooDeep);
}

}  // namespace
}  // namespace qn
