#include <gtest/gtest.h>

#include <cmath>

#include "platform/objects/Description.h"
#include "platform/objects/Value.h"

namespace kyt {
namespace {

TEST(Description, ShowsLeavesAsPeopleReadThem) {
  EXPECT_EQ(description(Value()), "(null)");
  EXPECT_EQ(description("a \"text\""), "a \"text\"");
  EXPECT_EQ(description(true), "1");
  EXPECT_EQ(description(false), "0");
  EXPECT_EQ(description(-12), "-12");
  EXPECT_EQ(description(UINT64_MAX), "18446744073709551615");
  EXPECT_EQ(description(0.1), "0.1");
  EXPECT_EQ(description(Data(std::string_view("\x00\xAB\x7F", 3))), "<00ab7f>");
}

TEST(Description, ShowsDatesInUniversalTime) {
  EXPECT_EQ(description(Date{0}), "1970-01-01 00:00:00 +0000");
  EXPECT_EQ(description(Date{1769860800}), "2026-01-31 12:00:00 +0000");
  EXPECT_EQ(description(Date{1709251199.9}), "2024-02-29 23:59:59 +0000");
  EXPECT_EQ(description(Date{-1}), "1969-12-31 23:59:59 +0000");
  EXPECT_EQ(description(Date{-0.5}), "1969-12-31 23:59:59 +0000");
  EXPECT_EQ(description(Date{-62135596800}), "0001-01-01 00:00:00 +0000");
  EXPECT_EQ(description(Date{1e300}), "1e+300");
  EXPECT_EQ(description(Date{std::nan("")}), "nan");
}

TEST(Description, ShowsContainersAsCompactJSON) {
  const Value value(Dictionary{{"a", Array{1, true, Value(), 2.5, "q\"\\\n\x01"}},
                               {"d", Date{0}},
                               {"x", Data(std::string_view("\x01"))},
                               {"n", HUGE_VAL},
                               {"e", Dictionary()}});
  EXPECT_EQ(description(value), R"({"a":[1,true,null,2.5,"q\"\\\n\u0001"],"d":"1970-01-01 00:00:00 +0000",)"
                                R"("x":"<01>","n":"inf","e":{}})");
}

TEST(Description, WritesTheShortestDecimalThatReadsBackTheSame) {
  EXPECT_EQ(decimalText(0), "0");
  EXPECT_EQ(decimalText(-0.0), "-0");
  EXPECT_EQ(decimalText(100000), "100000");
  EXPECT_EQ(decimalText(1409443200.123456), "1409443200.123456");
  EXPECT_EQ(decimalText(0.30000000000000004), "0.30000000000000004");
  EXPECT_EQ(decimalText(1e30), "1e+30");
  EXPECT_EQ(decimalText(5e-324), "5e-324");
  EXPECT_EQ(decimalText(-HUGE_VAL), "-inf");
}

TEST(FormatObjects, FillsEveryConversionWithTheNextObject) {
  EXPECT_EQ(formatObjects("%@?uuid=%s&sequence=%u&name=%@%%20(x)", {"http://h", "u", 7, Value()}),
            "http://h?uuid=u&sequence=7&name=(null)%20(x)");
  EXPECT_EQ(formatObjects("%@ %@", {1}), "1 (null)");
  EXPECT_EQ(formatObjects("%08llx|%-3d|100%", {1, 2}), "1|2|100%");
  EXPECT_EQ(formatObjects("", {1}), "");
}

}  // namespace
}  // namespace kyt
