#include "platform/linux/store_json.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cmath>
#include <limits>

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

  // Values JSON has no form for are written as strings of their printed form.
  Value date(Date{0});
  Value data(Data{{0xde, 0xad}});
  EXPECT_EQ(StoreJsonText(date), "\"" + date.Description() + "\"");
  EXPECT_EQ(StoreJsonText(data), "\"" + data.Description() + "\"");
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
