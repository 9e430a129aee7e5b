// The codecs every byte from a client goes through (framing, MessagePack, the request
// check), the JSON writer and reader, and atomic file writes.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <limits>
#include <nlohmann/json.hpp>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "common/Files.h"
#include "common/Frame.h"
#include "common/Json.h"
#include "common/MsgPack.h"
#include "common/Protocol.h"
#include "tests/fakes/TempDir.h"

namespace qn {
namespace {

using namespace protocol;

std::string Header(std::uint32_t length) {
  std::string h(4, '\0');
  for (int i = 0; i < 4; ++i)
    h[static_cast<std::size_t>(i)] = static_cast<char>(length >> (24 - 8 * i));
  return h;
}

std::vector<Value> SampleValues() {
  return {Value(Array{1, 7, 42}), Value("x"), Value(Dictionary{{"k", Array{1, 2, 3}}}),
          Value(std::string(70000, 'z')), Value()};
}

std::string SampleStream() {
  std::string stream;
  for (const Value& v : SampleValues()) EXPECT_TRUE(AppendFrame(stream, v));
  return stream;
}

// Feeds `stream` in pieces of the given sizes (cycled) and collects the decoded bodies.
std::vector<Value> FeedInPieces(FrameDecoder& decoder, std::string_view stream,
                                const std::vector<std::size_t>& sizes) {
  std::vector<Value> out;
  std::size_t at = 0, piece = 0;
  while (at < stream.size()) {
    std::size_t n = std::min(sizes[piece++ % sizes.size()], stream.size() - at);
    decoder.Feed(stream.substr(at, n));
    at += n;
    while (auto body = decoder.Next()) {
      auto decoded = DecodeMsgPack(*body);
      EXPECT_TRUE(std::holds_alternative<Value>(decoded));
      if (auto* v = std::get_if<Value>(&decoded)) out.push_back(*v);
    }
  }
  return out;
}

TEST(FrameTest, AnyChunkingYieldsEveryBodyInOrder) {
  const std::string stream = SampleStream() + SampleStream();
  std::vector<Value> expected = SampleValues();
  const std::vector<Value> again = SampleValues();
  expected.insert(expected.end(), again.begin(), again.end());
  std::mt19937 random(1234);
  for (int round = 0; round < 22; ++round) {
    std::vector<std::size_t> sizes;
    if (round == 0) sizes = {1};              // a byte at a time
    if (round == 1) sizes = {stream.size()};  // all at once
    for (int i = 0; round > 1 && i < 16; ++i) sizes.push_back(1 + random() % 9000);
    FrameDecoder decoder;
    EXPECT_EQ(FeedInPieces(decoder, stream, sizes), expected) << round;
    EXPECT_FALSE(decoder.error());
    EXPECT_EQ(decoder.buffered(), 0u);
  }
}

// A length of zero or over the maximum is a permanent error once the header is in: the
// frames before it still come out, later bytes are discarded. The maximum is accepted.
TEST(FrameTest, LengthsOfZeroOrOverTheMaximumArePermanentErrors) {
  for (std::uint32_t bad : {0u, static_cast<std::uint32_t>(kMaxBodyBytes + 1), 0xffffffffu}) {
    FrameDecoder decoder;
    std::string stream;
    AppendFrame(stream, Value(7));
    decoder.Feed(stream + Header(bad).substr(0, 3));
    EXPECT_TRUE(decoder.Next());
    EXPECT_FALSE(decoder.Next());
    EXPECT_FALSE(decoder.error());
    decoder.Feed(Header(bad).substr(3) + SampleStream());
    EXPECT_FALSE(decoder.Next());
    ASSERT_TRUE(decoder.error());
    EXPECT_EQ(decoder.error()->code, ConnectionError::kBadLength);
    EXPECT_EQ(decoder.error()->message,
              "bad frame length " + std::to_string(bad) + " (must be 1 to 1048576 bytes)");
    EXPECT_EQ(decoder.buffered(), 0u);
  }
  FrameDecoder decoder;
  decoder.Feed(Header(kMaxBodyBytes) + std::string(kMaxBodyBytes - 1, 'a'));
  EXPECT_FALSE(decoder.Next());
  decoder.Feed("b");
  auto body = decoder.Next();
  ASSERT_TRUE(body && body->size() == kMaxBodyBytes);
  EXPECT_FALSE(decoder.error());
}

using protocol::RequestProblem;

std::string Bytes(std::initializer_list<int> bytes) {
  std::string out;
  for (int b : bytes) out.push_back(static_cast<char>(b));
  return out;
}

RequestProblem MustFail(std::string_view body) {
  auto result = DecodeMsgPack(body);
  if (auto* problem = std::get_if<RequestProblem>(&result)) return *problem;
  ADD_FAILURE() << "decoded: " << std::get<Value>(result).Description();
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
       "uint64 needs 8 bytes, 2 left"}};
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
  EXPECT_TRUE(std::holds_alternative<Value>(DecodeMsgPack(NestedArrays(64))));
  EXPECT_TRUE(std::holds_alternative<Value>(DecodeMsgPack(NestedMaps(64))));
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

Value Request(std::initializer_list<Value> items) { return Value(Array(items)); }

// One row per request: accepted (no code), or refused with its code. In order: every
// operation well formed; not [op, id, ...]; unknown operations; wrong argument counts; the
// range of each argument kind (service type uint16, reporter ID int64, category uint32, type
// uint16, message or configuration a map, reporter IDs nil or an array of int64).
TEST(ProtocolTest, RequestsAreCheckedForShapeOperationAndArgumentKinds) {
  using enum ConnectionError;
  const Dictionary d{{"key", "value"}};
  const std::optional<ConnectionError> ok;
  const std::pair<Value, std::optional<ConnectionError>> cases[] = {
      {Request({1, 10, 42}), ok},
      {Request({2, 11, 65535, -42}), ok},
      {Request({3, 12, 0}), ok},
      {Request({4, 13, d, INT64_MAX}), ok},
      {Request({5, 14, INT64_MIN}), ok},
      {Request({6, 15, d, 4294967295LL, 0, Value()}), ok},
      {Request({6, 16, Dictionary{}, 0, 65535, Array{1, -2, INT64_MAX}}), ok},
      {Request({6, 17, d, 9, 0, Array{}}), ok},
      {Request({7, 18, 1}), ok},
      {Request({8, 19, 1}), ok},
      {Request({9, 20, 1}), ok},
      {Request({10, 21}), ok},
      {Request({11, 4294967295LL}), ok},
      {Value(1), kBadRequest},
      {Value(Dictionary{{"op", 1}}), kBadRequest},
      {Request({}), kBadRequest},
      {Request({1}), kBadRequest},
      {Request({"create", 1, 42}), kBadRequest},
      {Request({1.0, 1, 42}), kBadRequest},
      {Request({true, 1, 42}), kBadRequest},
      {Request({1, 0, 42}), kBadRequest},
      {Request({1, -1, 42}), kBadRequest},
      {Request({1, 4294967296LL, 42}), kBadRequest},
      {Request({1, 2.0, 42}), kBadRequest},
      {Request({1, Value(), 42}), kBadRequest},
      {Request({0, 1, 42}), kUnknownOp},
      {Request({12, 1}), kUnknownOp},
      {Request({-1, 1}), kUnknownOp},
      {Request({UINT64_MAX, 1}), kUnknownOp},
      {Request({1, 1}), kBadArguments},
      {Request({1, 1, 42, 43}), kBadArguments},
      {Request({2, 1, 5}), kBadArguments},
      {Request({10, 1, 0}), kBadArguments},
      {Request({11, 1, Value()}), kBadArguments},
      {Request({6, 1, d, 1, 1}), kBadArguments},
      {Request({2, 1, 0, 1}), ok},
      {Request({2, 1, 65536, 1}), kBadArguments},
      {Request({2, 1, -1, 1}), kBadArguments},
      {Request({2, 1, 5.0, 1}), kBadArguments},
      {Request({2, 1, true, 1}), kBadArguments},
      {Request({2, 1, "5", 1}), kBadArguments},
      {Request({1, 1, static_cast<std::uint64_t>(INT64_MAX) + 1}), kBadArguments},
      {Request({1, 1, 42.0}), kBadArguments},
      {Request({1, 1, Value()}), kBadArguments},
      {Request({6, 1, d, 4294967296LL, 0, Value()}), kBadArguments},
      {Request({6, 1, d, -1, 0, Value()}), kBadArguments},
      {Request({6, 1, d, 0, 65536, Value()}), kBadArguments},
      {Request({6, 1, Array{}, 0, 0, Value()}), kBadArguments},
      {Request({6, 1, Value(), 0, 0, Value()}), kBadArguments},
      {Request({4, 1, "config", 1}), kBadArguments},
      {Request({4, 1, Dictionary{{1, 2}}, 1}), ok},
      {Request({6, 1, d, 0, 0, Array{1, -1, INT64_MIN}}), ok},
      {Request({6, 1, d, 0, 0, Array{1, UINT64_MAX}}), kBadArguments},
      {Request({6, 1, d, 0, 0, Array{1, "2"}}), kBadArguments},
      {Request({6, 1, d, 0, 0, Array{1.5}}), kBadArguments},
      {Request({6, 1, d, 0, 0, Array{Array{1}}}), kBadArguments},
      {Request({6, 1, d, 0, 0, Dictionary{}}), kBadArguments},
      {Request({6, 1, d, 0, 0, 7}), kBadArguments}};
  for (const auto& [request, code] : cases) {
    auto result = ValidateRequest(request);
    if (auto* header = std::get_if<RequestHeader>(&result)) {
      EXPECT_FALSE(code) << "accepted: " << request.Description();
      EXPECT_EQ(static_cast<std::int64_t>(header->op),
                (*request.as_array())[0].as_int64().value_or(-1));
      EXPECT_EQ(header->request_id, *(*request.as_array())[1].as_uint64());
    } else {
      const auto& problem = std::get<RequestProblem>(result);
      EXPECT_EQ(problem.code, code) << request.Description() << ": " << problem.message;
      EXPECT_FALSE(problem.message.empty());
    }
  }
  auto result = ValidateRequest(Request({6, 9, d, 0, 0, Array{1, UINT64_MAX}}));
  EXPECT_EQ(std::get<RequestProblem>(result).message,
            "argument 4 of sendMessage:withCategory:andType:forReportingIDs:reply: must be an "
            "array of signed 64-bit integers or nil, got an array (element 1 is "
            "18446744073709551615) (request 9)");
}

Value Sample() {
  return Value(Dictionary{
      {"b", 1},
      {"a", Array{true, Value(), 1.5, "x\"y", -7}},
      {"e", Dictionary{}},
      {"f", Array{}},
      {"nested", Dictionary{{"k", "v"}, {"n", UINT64_MAX}}},
  });
}

std::string Strict(const Value& v, JsonStyle style = JsonStyle::kCompact) {
  std::string out;
  auto error = ToJson(v, style, out);
  EXPECT_FALSE(error) << error->Description();
  return out;
}

Error StrictError(const Value& v) {
  std::string out = "untouched";
  auto error = ToJson(v, JsonStyle::kPretty, out);
  EXPECT_EQ(out, "untouched");
  if (!error) {
    ADD_FAILURE() << "accepted " << v.Description();
    return {};
  }
  EXPECT_EQ(error->domain, kJsonErrorDomain);
  EXPECT_EQ(error->code, static_cast<std::int64_t>(JsonErrorCode::kInvalidValue));
  return *error;
}

TEST(JsonTest, StringsAreEscaped) {
  EXPECT_EQ(Strict(Value(std::string("q\"b\\n\n\t\r\b\f\x01\x1f/\x7f", 14))),
            R"("q\"b\\n\n\t\r\b\f\u0001\u001f/)"
            "\x7f\"");
  EXPECT_EQ(Strict(Value(std::string("nul\0byte", 8))), R"("nul\u0000byte")");
  EXPECT_EQ(Strict(Value("caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5")),
            "\"caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5\"");
}

TEST(JsonTest, StrictRejectsWhatJsonCannotHoldAndSaysWhere) {
  struct Case {
    Value value;
    std::string description;
  } cases[] = {{Value(Dictionary{{"payload", Dictionary{{"samples", Array{1, 2, Data{{1}}}}}}}),
                "JSON cannot hold data (at payload.samples[2])"},
               {Value(Date{0}), "JSON cannot hold a date (at the top level)"},
               {Value(Array{1.0, std::nan("")}), "JSON cannot hold NaN or infinity (at [1])"},
               {Value(Dictionary{{"x", -std::numeric_limits<double>::infinity()}}),
                "JSON cannot hold NaN or infinity (at x)"},
               {Value(Array{Dictionary{{"ok", 1}, {42, "v"}}}),
                "JSON object keys must be strings, not 42 (at [0])"},
               {Value(Dictionary{{"s", "a\xff"}}),
                "JSON cannot hold a string that is not valid UTF-8 (at s)"},
               {Value(Dictionary{{"\xc0\xaf", 1}}),
                "JSON cannot hold a string that is not valid UTF-8 (at the top level)"}};
  for (const auto& c : cases) EXPECT_EQ(StrictError(c.value).description, c.description);
}

TEST(JsonTest, LenientWritesEverything) {
  Dictionary d;
  d.Set("data", Data{{'f', 'o', 'o', 'b'}});
  d.Set("date", Date{1705329005.123});
  d.Set("nan", std::nan(""));
  d.Set("inf", std::numeric_limits<double>::infinity());
  d.Set(7, "number key");
  d.Set("7", "string key repeating the printed form");  // left out
  d.Set(true, "bool key");
  d.Set("bad",
        "a\xff"
        "b");
  d.Set("baddate", Date{std::nan("")});
  EXPECT_EQ(ToJsonLenient(Value(d)),
            R"({"data":"Zm9vYg==","date":"2024-01-15T14:30:05.123Z","nan":null,"inf":null,)"
            R"("7":"number key","1":"bool key","bad":"a)"
            "\xef\xbf\xbd"
            R"(b","baddate":null})");
  EXPECT_FALSE(nlohmann::json::parse(ToJsonLenient(Value(d)), nullptr, false).is_discarded());
  EXPECT_EQ(ToJsonLenient(Sample(), JsonStyle::kPretty), Strict(Sample(), JsonStyle::kPretty));
}

TEST(JsonTest, LenientReplacesEachInvalidUtf8Byte) {
  const std::string r = "\xef\xbf\xbd";  // U+FFFD
  EXPECT_EQ(
      ToJsonLenient(Value("bad \xFF \xC0\xAF \xED\xA0\x80 \xF4\x90\x80\x80 \xE2\x82")),
      "\"bad " + r + " " + r + r + " " + r + r + r + " " + r + r + r + r + " " + r + r + "\"");
  std::string all_bytes;
  for (int c = 0; c < 256; ++c) all_bytes.push_back(static_cast<char>(c));
  EXPECT_FALSE(
      nlohmann::json::parse(ToJsonLenient(Value(all_bytes)), nullptr, false).is_discarded());
}

TEST(JsonTest, VeryDeepValuesAreCutOffOrRejectedNotOverflowed) {
  Value v(1);
  for (int i = 0; i < 2000; ++i) v = Value(Array{v});
  auto parsed = nlohmann::json::parse(ToJsonLenient(v), nullptr, false);
  ASSERT_FALSE(parsed.is_discarded());
  int depth = 0;
  const nlohmann::json* level = &parsed;
  while (level->is_array()) {
    ASSERT_EQ(level->size(), 1u);
    level = &(*level)[0];
    ++depth;
  }
  EXPECT_TRUE(level->is_null());
  EXPECT_EQ(depth, kMaxJsonWriteDepth + 1);
  std::string out;
  auto error = ToJson(v, JsonStyle::kCompact, out);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, static_cast<std::int64_t>(JsonErrorCode::kInvalidValue));
}

TEST(JsonTest, ParseErrorsAndDepthLeaveTheOutputAlone) {
  auto nested = [](int depth) { return std::string(depth, '[') + std::string(depth, ']'); };
  std::string objects;
  for (int i = 0; i <= kMaxJsonDepth; ++i) objects += "{\"k\":";
  objects += "1" + std::string(kMaxJsonDepth + 1, '}');
  const std::pair<std::string, JsonErrorCode> cases[] = {
      {"", JsonErrorCode::kParse},
      {"{", JsonErrorCode::kParse},
      {"[1,]", JsonErrorCode::kParse},
      {"tru", JsonErrorCode::kParse},
      {"1 2", JsonErrorCode::kParse},
      {"{\"a\" 1}", JsonErrorCode::kParse},
      {"\"\xff\"", JsonErrorCode::kParse},
      {"[1] x", JsonErrorCode::kParse},
      {nested(kMaxJsonDepth + 1), JsonErrorCode::kTooDeep},
      {nested(100000), JsonErrorCode::kTooDeep},
      {objects, JsonErrorCode::kTooDeep}};
  for (const auto& [text, code] : cases) {
    Value v("untouched");
    auto error = ParseJson(text, v);
    ASSERT_TRUE(error) << text.substr(0, 20);
    EXPECT_EQ(error->domain, kJsonErrorDomain);
    EXPECT_EQ(error->code, static_cast<std::int64_t>(code)) << text.substr(0, 20);
    if (code == JsonErrorCode::kParse) {
      EXPECT_NE(error->description.find("parse error"), std::string::npos);
    }
    EXPECT_EQ(v, Value("untouched"));
  }
  Value v;
  EXPECT_FALSE(ParseJson(nested(kMaxJsonDepth), v));
}

namespace fs = std::filesystem;

class FilesTest : public ::testing::Test {
 protected:
  FilesTest() : old_umask_(umask(022)) {}
  ~FilesTest() override { umask(old_umask_); }

  static mode_t ModeOf(const std::string& path) {
    struct stat st;
    EXPECT_EQ(stat(path.c_str(), &st), 0) << path;
    return st.st_mode & 07777;
  }
  std::vector<std::string> Listing(const std::string& dir) const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(dir)) {
      names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

  const mode_t old_umask_;
  testing::TempDir dir_;
  const std::string& root_ = dir_.path();
};

TEST_F(FilesTest, CreatedDirectoriesGetExactlyTheModeDespiteTheUmask) {
  const std::string existing = root_ + "/existing";
  ASSERT_EQ(mkdir(existing.c_str(), 0700), 0);
  const std::string deep = existing + "/a//b/c/";
  ASSERT_FALSE(CreateDirectories(deep, 0777));
  EXPECT_EQ(ModeOf(existing), 0700u);  // not created here: left as it was
  EXPECT_EQ(ModeOf(existing + "/a"), 0777u);
  EXPECT_EQ(ModeOf(existing + "/a/b"), 0777u);
  EXPECT_EQ(ModeOf(existing + "/a/b/c"), 0777u);
  EXPECT_FALSE(CreateDirectories(deep, 0777));  // exists already: fine

  ASSERT_FALSE(CreateDirectories(root_ + "/private/x", 0700));
  EXPECT_EQ(ModeOf(root_ + "/private/x"), 0700u);
}

TEST_F(FilesTest, AtomicWriteFailuresLeaveNothingBehind) {
  // Target is a directory: the rename fails after the temporary was written.
  ASSERT_FALSE(CreateDirectories(root_ + "/dir.json", 0755));
  auto error = WriteFileAtomically(root_ + "/dir.json", "text");
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, "posix");
  EXPECT_NE(error->description.find("rename"), std::string::npos) << error->description;
  EXPECT_EQ(Listing(root_), (std::vector<std::string>{"dir.json"}));

  // Missing directory, and a path component that is a file.
  EXPECT_TRUE(WriteFileAtomically(root_ + "/missing/file.json", "text"));
  std::ofstream(root_ + "/plain") << "x";
  error = WriteFileAtomically(root_ + "/plain/file.json", "text");
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ENOTDIR);
  EXPECT_EQ(testing::ReadFileText(root_ + "/plain"), "x");
  EXPECT_EQ(Listing(root_), (std::vector<std::string>{"dir.json", "plain"}));
  EXPECT_TRUE(WriteFileAtomically(root_ + "/", "text"));
}

}  // namespace
}  // namespace qn
