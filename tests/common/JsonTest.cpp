#include "common/Json.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <limits>
#include <nlohmann/json.hpp>
#include <random>
#include <string>
#include <utility>

namespace qn {
namespace {

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
  } cases[] = {
      {Value(Dictionary{{"payload", Dictionary{{"samples", Array{1, 2, Data{{1}}}}}}}),
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
       "JSON cannot hold a string that is not valid UTF-8 (at the top level)"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(StrictError(c.value).description, c.description);
  }
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
  // Stray, overlong, surrogate, above U+10FFFF, truncated.
  EXPECT_EQ(
      ToJsonLenient(Value("bad \xFF \xC0\xAF \xED\xA0\x80 \xF4\x90\x80\x80 \xE2\x82")),
      "\"bad " + r + " " + r + r + " " + r + r + r + " " + r + r + r + r + " " + r + r + "\"");
  // Whatever the bytes, a strict parser accepts the result.
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
      {objects, JsonErrorCode::kTooDeep},
  };
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

}  // namespace
}  // namespace qn
