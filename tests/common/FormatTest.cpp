#include "common/Format.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cmath>
#include <memory>

#include "common/Error.h"

namespace qn {
namespace {

struct Named {
  std::string Description() const { return "named"; }
};

TEST(FormatTest, IntegerConversionsTakeAnyWidth) {
  EXPECT_EQ(StringWithFormat("%lli|%i|%lu|%d", INT64_MIN, -5, std::size_t{42}, 7u),
            "-9223372036854775808|-5|42|7");
  EXPECT_EQ(StringWithFormat("%llu", UINT64_MAX), "18446744073709551615");
  EXPECT_EQ(StringWithFormat("%5d|%-5d|%05d|%x|%X", 42, 42, 42, 255, 255),
            "   42|42   |00042|ff|FF");
  EXPECT_EQ(StringWithFormat("%hhu %zu %qd", 3, std::size_t{4}, 5), "3 4 5");
  EXPECT_EQ(StringWithFormat("%c%c", 'o', 'k'), "ok");
}

TEST(FormatTest, ObjectsAndStrings) {
  Value dict(Dictionary{{"k", 1}});
  EXPECT_EQ(StringWithFormat("%@ / %@ / %@", dict, Value("text"), Value(3)),
            "{\n    k = 1;\n} / text / 3");
  EXPECT_EQ(StringWithFormat("%@ %@ %@", Named{}, std::make_shared<Named>(), NullObject{}),
            "named named (null)");
  EXPECT_EQ(StringWithFormat("%@", std::shared_ptr<Named>()), "(null)");
  EXPECT_EQ(StringWithFormat("%s|%-6s|%.2s", "abc", std::string("de"), "xyz"), "abc|de    |xy");
  EXPECT_EQ(StringWithFormat("%s", static_cast<const char*>(nullptr)), "(null)");
  EXPECT_EQ(StringWithFormat("%s:%d:%s: ending session %lli", "QNReportingSession.cpp", 123,
                             "void qn::QNReportingSession::stop()", 42),
            "QNReportingSession.cpp:123:void qn::QNReportingSession::stop(): ending session 42");
}

TEST(FormatTest, FloatingPoint) {
  EXPECT_EQ(StringWithFormat("%f|%.2f|%g|%e", 1.5, 2.345, 0.0001, 100.0),
            "1.500000|2.35|0.0001|1.000000e+02");
  EXPECT_EQ(StringWithFormat("%f", 3), "3.000000");  // an integer where a float is expected
  EXPECT_EQ(StringWithFormat("%@", 0.1), "0.1");
}

TEST(FormatTest, PercentMissingArgumentsAndUnknownConversions) {
  EXPECT_EQ(StringWithFormat("100%%"), "100%");
  EXPECT_EQ(StringWithFormat("%d and %@ and %s", 1), "1 and (missing) and (missing)");
  // An unknown conversion is copied as written and takes no argument.
  EXPECT_EQ(StringWithFormat("%k %lk %d", 9), "%k %lk 9");
  EXPECT_EQ(StringWithFormat("%k"), "%k");
  EXPECT_EQ(StringWithFormat("trailing %"), "trailing %");
  EXPECT_EQ(StringWithFormat("trailing %-5"), "trailing %-5");
  EXPECT_EQ(StringWithFormat("extra", 1, 2), "extra");
}

TEST(FormatTest, DoublesForIntegerConversionsSaturate) {
  EXPECT_EQ(StringWithFormat("%d", 2.9), "2");
  EXPECT_EQ(StringWithFormat("%d", std::nan("")), "0");
  EXPECT_EQ(StringWithFormat("%lld", 1e300), "9223372036854775807");
  EXPECT_EQ(StringWithFormat("%lld", -1e300), "-9223372036854775808");
}

TEST(FormatTest, ErrnoErrorNamesTheOperation) {
  Error e = ErrnoError("open /nowhere", ENOENT);
  EXPECT_EQ(e.domain, "posix");
  EXPECT_EQ(e.code, ENOENT);
  EXPECT_EQ(e.Description(), "open /nowhere: No such file or directory");
  EXPECT_EQ((Error{"d", 3, ""}).Description(), "d error 3");
}

}  // namespace
}  // namespace qn
