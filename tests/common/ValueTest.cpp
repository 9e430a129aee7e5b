#include "common/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>
#include <unordered_set>

namespace qn {
namespace {

TEST(ValueTest, PrintedFormOfScalars) {
  EXPECT_EQ(Value(42).Description(), "42");
  EXPECT_EQ(Value(-7).Description(), "-7");
  EXPECT_EQ(Value(UINT64_MAX).Description(), "18446744073709551615");
  EXPECT_EQ(Value(1.5).Description(), "1.5");
  EXPECT_EQ(Value(2.0).Description(), "2");
  EXPECT_EQ(Value(true).Description(), "1");
  EXPECT_EQ(Value("two words").Description(), "two words");  // top level: as itself
  EXPECT_EQ(Value(Data{{0x01, 0xab}}).Description(), "<01ab>");
  EXPECT_EQ(Value(Date{1705329005.9}).Description(), "2024-01-15 14:30:05 +0000");
  EXPECT_EQ(Value().Description(), "<null>");
  // Dates with no calendar form print their seconds instead of failing.
  EXPECT_EQ(Value(Date{std::nan("")}).Description(), "nan");
  EXPECT_EQ(Value(Date{1e300}).Description(), "1e+300");
}

TEST(ValueTest, PrintedFormOfNestedCollections) {
  Value v(Dictionary{
      {"a", 1},
      {"list", Array{1, "two words", Dictionary{{"k", "v"}}, Array{}}},
      {"empty", Dictionary{}},
  });
  EXPECT_EQ(v.Description(),
            "{\n"
            "    a = 1;\n"
            "    list = (\n"
            "        1,\n"
            "        \"two words\",\n"
            "        {\n"
            "            k = v;\n"
            "        },\n"
            "        (\n"
            "        )\n"
            "    );\n"
            "    empty = {\n"
            "    };\n"
            "}");
  EXPECT_EQ(Value(Array{"quote\"d", "line\nbreak"}).Description(),
            "(\n    \"quote\\\"d\",\n    \"line\\nbreak\"\n)");
}

TEST(ValueTest, NumbersCompareByExactValue) {
  EXPECT_EQ(Value(1), Value(1.0));
  EXPECT_EQ(Value(1u), Value(1));
  EXPECT_EQ(Value(-0.0), Value(0));
  EXPECT_NE(Value(1), Value(true));
  EXPECT_NE(Value(1), Value("1"));
  EXPECT_NE(Value(1), Value(1.5));
  // 2^53 + 1 has no double; it must not equal the double 2^53 it would round to.
  const std::int64_t big = (std::int64_t{1} << 53) + 1;
  EXPECT_NE(Value(big), Value(9007199254740992.0));
  EXPECT_EQ(Value(big - 1), Value(9007199254740992.0));
  // The uint64 range: 2^63 is a uint64 and an exact double.
  EXPECT_EQ(Value(std::uint64_t{1} << 63), Value(9223372036854775808.0));
  EXPECT_NE(Value(INT64_MAX), Value(9223372036854775808.0));
  EXPECT_NE(Value(UINT64_MAX), Value(18446744073709551616.0));
  const double nan = std::nan("");
  EXPECT_EQ(Value(nan), Value(nan));  // so that a NaN key can be found
  EXPECT_NE(Value(nan), Value(0));
}

// Lookups by value must agree between the linear scan of a small dictionary and the hash
// index of a large one, for keys of every numeric kind.
TEST(ValueTest, NumericKeyLookupSmallAndIndexed) {
  for (int extra : {0, 30}) {
    Dictionary d;
    d.Set(1, "one");
    d.Set(std::uint64_t{1} << 63, "two to the 63");
    d.Set(std::nan(""), "nan");
    d.Set(9007199254740992.0, "2^53");
    for (int i = 0; i < extra; ++i) d.Set("filler" + std::to_string(i), i);
    SCOPED_TRACE(d.size());
    ASSERT_NE(d.Find(Value(1.0)), nullptr);
    EXPECT_EQ(*d.Find(Value(1.0)), Value("one"));
    EXPECT_EQ(d.Find(Value(true)), nullptr);
    EXPECT_EQ(d.Find(Value("1")), nullptr);
    ASSERT_NE(d.Find(Value(9223372036854775808.0)), nullptr);
    EXPECT_EQ(*d.Find(Value(9223372036854775808.0)), Value("two to the 63"));
    EXPECT_EQ(*d.Find(Value(std::nan(""))), Value("nan"));
    EXPECT_EQ(*d.Find(Value(std::int64_t{1} << 53)), Value("2^53"));
    EXPECT_EQ(d.Find(Value((std::int64_t{1} << 53) + 1)), nullptr);
    d.Set(std::nan(""), "nan again");  // replaces, does not add
    EXPECT_EQ(d.size(), 4u + static_cast<std::size_t>(extra));
  }
}

TEST(ValueTest, ReplaceKeepsPosition) {
  Dictionary d{{"a", 1}, {"b", 2}, {"c", 3}};
  d.Set("b", 20);
  d.Set(1.0, "number");
  d.Set(1, "replaced");  // 1 == 1.0: same key
  std::vector<std::string> order;
  for (const auto& [k, v] : d) order.push_back(k.Description() + "=" + v.Description());
  EXPECT_EQ(order, (std::vector<std::string>{"a=1", "b=20", "c=3", "1=replaced"}));
}

TEST(ValueTest, LargeDictionaryIndexSurvivesErase) {
  Dictionary d;
  for (int i = 0; i < 40; ++i) d.Set("k" + std::to_string(i), i);
  d.Set("k5", 500);  // replace while indexed
  for (int i = 0; i < 40; i += 3) EXPECT_TRUE(d.Erase(Value("k" + std::to_string(i))));
  EXPECT_FALSE(d.Erase(Value("k0")));
  for (int i = 0; i < 40; ++i) {
    const Value* found = d.Find("k" + std::to_string(i));
    if (i % 3 == 0) {
      EXPECT_EQ(found, nullptr) << i;
    } else {
      ASSERT_NE(found, nullptr) << i;
      EXPECT_EQ(*found, Value(i == 5 ? 500 : i));
    }
  }
  // Order is insertion order without the erased keys.
  auto it = d.begin();
  EXPECT_EQ(it->first, Value("k1"));
  EXPECT_EQ((++it)->first, Value("k2"));
  EXPECT_EQ((++it)->first, Value("k4"));
  // Shrink below the index threshold and grow past it again.
  for (int i = 0; i < 40; ++i) d.Erase(Value("k" + std::to_string(i)));
  EXPECT_TRUE(d.empty());
  for (int i = 0; i < 20; ++i) d.Set(i, i * 2);
  for (int i = 0; i < 20; ++i) EXPECT_EQ(*d.Find(Value(static_cast<double>(i))), Value(i * 2));
  d.Erase(Value(3));
  d.Erase(Value(4));
  d.Erase(Value(5));
  d.Erase(Value(6));
  d.Erase(Value(7));
  EXPECT_EQ(d.size(), 15u);
  EXPECT_EQ(*d.Find(Value(19)), Value(38));
  EXPECT_EQ(d.Find(Value(5)), nullptr);
}

// Keys a client picks to share one bucket of a known bucket count (multiples of it) must
// still spread out, or a large map's index degrades to a linear scan per insertion.
TEST(ValueTest, HashSpreadsKeysChosenToCollide) {
  for (std::uint64_t buckets : {1031u, 42043u, 116731u}) {
    std::unordered_set<std::size_t> used;
    for (std::uint64_t i = 1; i <= 1000; ++i) used.insert(Value(i * buckets).Hash() % buckets);
    EXPECT_GT(used.size(), 500u) << buckets;
  }
}

TEST(ValueTest, CollectionEqualityIgnoresDictionaryOrderOnly) {
  EXPECT_EQ(Value(Dictionary{{"a", 1}, {"b", 2}}), Value(Dictionary{{"b", 2}, {"a", 1.0}}));
  EXPECT_NE(Value(Array{1, 2}), Value(Array{2, 1}));
  EXPECT_EQ(Value(Dictionary{{"a", 1}, {"b", 2}}).Hash(),
            Value(Dictionary{{"b", 2}, {"a", 1}}).Hash());
  Value shared(Array{1, Dictionary{{"x", Array{}}}});
  Value copy = shared;  // shares the storage
  EXPECT_EQ(copy.as_array(), shared.as_array());
  EXPECT_EQ(copy, shared);
}

}  // namespace
}  // namespace qn
