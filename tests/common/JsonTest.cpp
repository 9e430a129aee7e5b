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

TEST(JsonTest, CompactAndPrettyForms) {
  EXPECT_EQ(Strict(Sample()), R"({"b":1,"a":[true,null,1.5,"x\"y",-7],"e":{},"f":[],)"
                              R"("nested":{"k":"v","n":18446744073709551615}})");
  EXPECT_EQ(Strict(Sample(), JsonStyle::kPretty), R"({
  "b": 1,
  "a": [
    true,
    null,
    1.5,
    "x\"y",
    -7
  ],
  "e": {},
  "f": [],
  "nested": {
    "k": "v",
    "n": 18446744073709551615
  }
})");
  // nlohmann, reading our text and printing it again, agrees byte for byte.
  std::string pretty = Strict(Sample(), JsonStyle::kPretty);
  EXPECT_EQ(nlohmann::ordered_json::parse(pretty).dump(2), pretty);
  EXPECT_EQ(nlohmann::ordered_json::parse(pretty).dump(), Strict(Sample()));
  EXPECT_EQ(Strict(Value("top")), "\"top\"");  // a top-level scalar is fine
}

TEST(JsonTest, StringsAreEscaped) {
  EXPECT_EQ(Strict(Value(std::string("q\"b\\n\n\t\r\b\f\x01\x1f/\x7f", 14))),
            R"("q\"b\\n\n\t\r\b\f\u0001\u001f/)"
            "\x7f\"");
  EXPECT_EQ(Strict(Value(std::string("nul\0byte", 8))), R"("nul\u0000byte")");
  EXPECT_EQ(Strict(Value("caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5")),
            "\"caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5\"");
}

// Strings are scanned eight bytes at a time: every ASCII byte at every offset in a word,
// and runs longer than the writer's buffer, come out as a reference writer writes them.
TEST(JsonTest, StringsMatchAReferenceWriterAtEveryOffset) {
  for (int c = 0; c < 0x80; ++c) {
    for (std::size_t offset = 0; offset < 17; ++offset) {
      std::string s = std::string(offset, 'a') + static_cast<char>(c) + "bcdefghÃ©xyz";
      EXPECT_EQ(Strict(Value(s)), nlohmann::json(s).dump()) << c << " at " << offset;
    }
  }
  const std::string long_text = std::string(40000, 'x') + "â¬" + std::string(20000, '"');
  EXPECT_EQ(ToJsonLenient(Value(long_text)), nlohmann::json(long_text).dump());
}

TEST(JsonTest, NumbersReadBackExactly) {
  const std::pair<Value, const char*> cases[] = {
      {Value(std::numeric_limits<std::int64_t>::min()), "-9223372036854775808"},
      {Value(1.0), "1.0"},
      {Value(-0.0), "-0.0"},
      {Value(0.1), "0.1"},
      {Value(1.0 / 3), "0.3333333333333333"},
      {Value(1000000.0), "1000000.0"},
      // Fixed notation from 1e-5 up to below 1e17, scientific outside.
      {Value(1e16), "10000000000000000.0"},
      {Value(1e17), "1e+17"},
      {Value(123456789012345678.0), "1.2345678901234568e+17"},
      {Value(1e-5), "0.00001"},
      {Value(9.99e-6), "9.99e-06"},
      {Value(2.5e-7), "2.5e-07"},
      {Value(1e300), "1e+300"},
      {Value(5e-324), "5e-324"},
      {Value(std::numeric_limits<double>::max()), "1.7976931348623157e+308"},
  };
  for (const auto& [value, text] : cases) EXPECT_EQ(Strict(value), text);
  std::mt19937_64 random(99);
  for (int i = 0; i < 2000; ++i) {
    std::uint64_t bits = random();
    double d;
    std::memcpy(&d, &bits, sizeof d);
    if (!std::isfinite(d)) continue;
    std::string text = Strict(Value(d));
    EXPECT_EQ(nlohmann::json::parse(text).get<double>(), d) << text;
    Value back;
    ASSERT_FALSE(ParseJson(text, back));
    EXPECT_EQ(back.kind(), Value::Kind::kDouble) << text;
    EXPECT_EQ(back, Value(d)) << text;
  }
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

TEST(JsonTest, AppendJsonLenientAppends) {
  std::string buffer = "prefix:";
  AppendJsonLenient(buffer, Value(Dictionary{{"k", "v"}}));
  EXPECT_EQ(buffer, R"(prefix:{"k":"v"})");
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

TEST(JsonTest, LenientBase64AndDates) {
  const char* expected[] = {"\"\"",         "\"Zg==\"",     "\"Zm8=\"",    "\"Zm9v\"",
                            "\"Zm9vYg==\"", "\"Zm9vYmE=\"", "\"Zm9vYmFy\""};
  std::string text = "foobar";
  for (std::size_t n = 0; n <= text.size(); ++n) {
    Data data{std::vector<std::uint8_t>(text.begin(), text.begin() + static_cast<long>(n))};
    EXPECT_EQ(ToJsonLenient(Value(data)), expected[n]);
  }
  EXPECT_EQ(ToJsonLenient(Value(Date{0})), "\"1970-01-01T00:00:00.000Z\"");
  EXPECT_EQ(ToJsonLenient(Value(Date{1705329005.9996})), "\"2024-01-15T14:30:06.000Z\"");
  EXPECT_EQ(ToJsonLenient(Value(Date{-0.5})), "\"1969-12-31T23:59:59.500Z\"");
  EXPECT_EQ(ToJsonLenient(Value(Date{1e20})), "null");  // beyond any calendar
}

TEST(JsonTest, ParsesIntoValuesInOrder) {
  Value v;
  ASSERT_FALSE(ParseJson(
      R"( {"z": 1, "a": [-2, 18446744073709551615, 9223372036854775807, 1.0, 2e3, "\u00e9"],)"
      R"( "m": {"t": true, "f": false, "n": null}, "z": 3} )",
      v));
  ASSERT_TRUE(v.is_dictionary());
  std::vector<std::string> keys;
  for (const auto& [k, unused] : *v.as_dictionary()) keys.push_back(*k.as_string());
  EXPECT_EQ(keys, (std::vector<std::string>{"z", "a", "m"}));  // repeated "z" keeps its place
  EXPECT_EQ(*v.as_dictionary()->Find("z"), Value(3));
  const Array& a = *v.as_dictionary()->Find("a")->as_array();
  EXPECT_EQ(a[0].kind(), Value::Kind::kInt);
  EXPECT_EQ(a[1].kind(), Value::Kind::kUInt);
  EXPECT_EQ(a[2].kind(), Value::Kind::kInt);
  EXPECT_EQ(a[3].kind(), Value::Kind::kDouble);
  EXPECT_EQ(a[4], Value(2000));
  EXPECT_EQ(a[5], Value("\xc3\xa9"));
  EXPECT_EQ(*v.as_dictionary()->Find("m"),
            Value(Dictionary{{"t", true}, {"f", false}, {"n", Value()}}));

  Value round_trip;
  ASSERT_FALSE(ParseJson(Strict(Sample(), JsonStyle::kPretty), round_trip));
  EXPECT_EQ(round_trip, Sample());
  EXPECT_EQ(Strict(round_trip), Strict(Sample()));
}

TEST(JsonTest, ParseErrorsLeaveTheOutputAlone) {
  for (const char* text : {"", "{", "[1,]", "tru", "1 2", "{\"a\" 1}", "\"\xff\"", "[1] x"}) {
    Value v("untouched");
    auto error = ParseJson(text, v);
    ASSERT_TRUE(error) << text;
    EXPECT_EQ(error->domain, kJsonErrorDomain);
    EXPECT_EQ(error->code, static_cast<std::int64_t>(JsonErrorCode::kParse)) << text;
    EXPECT_NE(error->description.find("parse error"), std::string::npos) << error->description;
    EXPECT_EQ(v, Value("untouched"));
  }
}

TEST(JsonTest, ParseDepthIsLimited) {
  auto nested = [](int depth) { return std::string(depth, '[') + std::string(depth, ']'); };
  Value v;
  EXPECT_FALSE(ParseJson(nested(kMaxJsonDepth), v));
  for (int depth : {kMaxJsonDepth + 1, 100000}) {
    auto error = ParseJson(nested(depth), v);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, static_cast<std::int64_t>(JsonErrorCode::kTooDeep));
  }
  std::string objects;
  for (int i = 0; i <= kMaxJsonDepth; ++i) objects += "{\"k\":";
  objects += "1" + std::string(kMaxJsonDepth + 1, '}');
  auto error = ParseJson(objects, v);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, static_cast<std::int64_t>(JsonErrorCode::kTooDeep));
}

}  // namespace
}  // namespace qn
