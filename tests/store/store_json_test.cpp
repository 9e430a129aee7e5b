#include "platform/linux/store_json.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cmath>
#include <limits>
#include <vector>

#include "common/Json.h"

namespace qn {
namespace {

TEST(StoreJsonTest, ScalarsKeepTheirKinds) {
  EXPECT_EQ(StoreJsonText(Value()), "null");
  EXPECT_EQ(StoreJsonText(Value(true)), "true");
  EXPECT_EQ(StoreJsonText(Value(false)), "false");
  EXPECT_EQ(StoreJsonText(Value(-42)), "-42");
  EXPECT_EQ(StoreJsonText(Value(std::numeric_limits<std::int64_t>::min())), "-9223372036854775808");
  EXPECT_EQ(StoreJsonText(Value(std::numeric_limits<std::uint64_t>::max())),
            "18446744073709551615");
  // A double stays recognisable as one, and round-trips exactly.
  EXPECT_EQ(StoreJsonText(Value(2.0)), "2.0");
  EXPECT_EQ(StoreJsonText(Value(-0.5)), "-0.5");
  EXPECT_EQ(StoreJsonText(Value(1e300)), "1e+300");
  EXPECT_EQ(StoreJsonText(Value(1e16)), "10000000000000000.0");
  EXPECT_EQ(nlohmann::json::parse(StoreJsonText(Value(0.1))).get<double>(), 0.1);
  EXPECT_EQ(StoreJsonText(Value(std::nan(""))), "null");
  EXPECT_EQ(StoreJsonText(Value(-std::numeric_limits<double>::infinity())), "null");
}

TEST(StoreJsonTest, StringsAreEscapedAndMadeValidUtf8) {
  EXPECT_EQ(StoreJsonText(Value("plain")), "\"plain\"");
  EXPECT_EQ(StoreJsonText(Value("a\"b\\c\n\t\r\b\f")), R"("a\"b\\c\n\t\r\b\f")");
  EXPECT_EQ(StoreJsonText(Value(std::string("\x01\x1f", 2))), R"("\u0001\u001f")");
  EXPECT_EQ(StoreJsonText(Value(std::string("nul\0byte", 8))), R"("nul\u0000byte")");
  // Valid multi-byte sequences pass unchanged.
  EXPECT_EQ(StoreJsonText(Value("caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5")),
            "\"caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5\"");
  // Stray, truncated, overlong and surrogate bytes each become U+FFFD.
  EXPECT_EQ(StoreJsonText(Value("a\xFF"
                                "b")),
            "\"a\xEF\xBF\xBD"
            "b\"");
  EXPECT_EQ(StoreJsonText(Value("\xE2\x82")), "\"\xEF\xBF\xBD\xEF\xBF\xBD\"");
  EXPECT_EQ(StoreJsonText(Value("\xC0\xAF")), "\"\xEF\xBF\xBD\xEF\xBF\xBD\"");
  EXPECT_EQ(StoreJsonText(Value("\xED\xA0\x80")), "\"\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\"");
  // Whatever the bytes, a strict parser accepts the result.
  std::string all_bytes;
  for (int c = 0; c < 256; ++c) all_bytes.push_back(static_cast<char>(c));
  EXPECT_FALSE(
      nlohmann::json::parse(StoreJsonText(Value(all_bytes)), nullptr, false).is_discarded());
}

TEST(StoreJsonTest, CollectionsKeepOrderAndLenientKeys) {
  Dictionary inner{{"z", 1}, {"a", Array{Value(1), Value("x"), Value()}}};
  Dictionary outer{{"second", 2}, {"first", Value(inner)}, {Value(7), "number key"}};
  EXPECT_EQ(StoreJsonText(Value(outer)),
            R"({"second":2,"first":{"z":1,"a":[1,"x",null]},"7":"number key"})");
  EXPECT_EQ(StoreJsonText(Value(Array{})), "[]");
  EXPECT_EQ(StoreJsonText(Value(Dictionary{})), "{}");

  // Values JSON has no form for: data as base64, dates as ISO-8601 strings.
  EXPECT_EQ(StoreJsonText(Value(Data{{0xde, 0xad, 0xbe, 0xef}})), R"("3q2+7w==")");
  EXPECT_EQ(StoreJsonText(Value(Date{1705329005.123})), R"("2024-01-15T14:30:05.123Z")");
  // A number key whose printed form repeats a string key: the later entry is left out.
  EXPECT_EQ(StoreJsonText(Value(Dictionary{{"1", "string"}, {Value(1), "number"}})),
            R"({"1":"string"})");
}

// The store writes exactly what the program's lenient serialiser writes, so that the
// rows read the same as every other JSON the service produces.
TEST(StoreJsonTest, MatchesTheLenientSerialiserByteForByte) {
  static constexpr char kControls[] = "ctl\x00\x01\x1f\x7f \" \\ \b\f\n\r\t";
  std::vector<Value> corpus = {
      Value(),
      Value(true),
      Value(0),
      Value(-1),
      Value(std::numeric_limits<std::int64_t>::max()),
      Value(std::numeric_limits<std::uint64_t>::max()),
      Value(0.0),
      Value(-0.0),
      Value(2.0),
      Value(0.1),
      Value(1.0 / 3),
      Value(1e16),
      Value(1e17),
      Value(123456789012345678.0),
      Value(1e-5),
      Value(9.99e-6),
      Value(-1e300),
      Value(5e-324),
      Value(std::numeric_limits<double>::max()),
      Value(std::nan("")),
      Value(std::numeric_limits<double>::infinity()),
      Value(""),
      Value("plain text with spaces and punctuation !#$%&'()*+,-./:;<=>?@[]^_`{|}~"),
      Value(std::string(kControls, sizeof kControls - 1)),
      Value("caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x8E\xB5 \xEF\xBF\xBF"),
      Value("bad \xFF \xC0\xAF \xED\xA0\x80 \xF4\x90\x80\x80 \xE2\x82"),
      Value(std::string(40000, 'x') + "\xE2\x82\xAC" + std::string(20000, '"')),
      Value(Data{}),
      Value(Data{{1}}),
      Value(Data{{1, 2}}),
      Value(Data{{1, 2, 3}}),
      Value(Date{0}),
      Value(Date{-1.5}),
      Value(Date{1e20}),
      Value(Array{}),
      Value(Dictionary{}),
  };
  std::string all_bytes;
  for (int c = 0; c < 256; ++c) all_bytes.push_back(static_cast<char>(c));
  corpus.push_back(Value(all_bytes));
  Dictionary mixed_keys{{"a", 1},
                        {Value(2), "two"},
                        {Value(true), Array{}},
                        {"2", "dup"},
                        {Value(Data{{9}}), Value(Date{1})}};
  Array nested;
  for (const Value& v : corpus) nested.push_back(v);
  corpus.push_back(Value(mixed_keys));
  corpus.push_back(Value(nested));
  corpus.push_back(
      Value(Dictionary{{"deep", Value(Array{Value(Dictionary{{"k", Value(nested)}})})}}));

  for (const Value& v : corpus) {
    EXPECT_EQ(StoreJsonText(v), ToJsonLenient(v, JsonStyle::kCompact)) << v.Description();
  }
}

TEST(StoreJsonTest, AppendsWithoutClearingTheBuffer) {
  std::string buffer = "prefix:";
  AppendJson(buffer, Value(Dictionary{{"k", "v"}}));
  EXPECT_EQ(buffer, R"(prefix:{"k":"v"})");
}

TEST(StoreJsonTest, VeryDeepValuesAreCutOffNotOverflowed) {
  Value v(1);
  for (int i = 0; i < 2000; ++i) v = Value(Array{v});
  auto parsed = nlohmann::json::parse(StoreJsonText(v), nullptr, false);
  ASSERT_FALSE(parsed.is_discarded());
  int depth = 0;
  while (parsed.is_array()) {
    parsed = parsed[0];
    ++depth;
  }
  EXPECT_TRUE(parsed.is_null());
  EXPECT_LT(depth, 2000);
}

}  // namespace
}  // namespace qn
