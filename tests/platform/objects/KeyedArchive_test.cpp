// Objects as CBOR and back. Expected bytes are written by hand from RFC 8949, most from its appendix A.
#include "platform/objects/KeyedArchive.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

std::string hexOf(const Value& value) {
  const std::optional<Data> data = archivedData(value);
  if (!data) return "none";
  std::string out;
  for (const char c : data->view()) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(c));
    out += digits;
  }
  return out;
}

std::string bytesOf(std::string_view hex) {
  std::string out;
  for (size_t i = 0; i + 1 < hex.size(); i += 2)
    out += static_cast<char>(std::stoi(std::string(hex.substr(i, 2)), nullptr, 16));
  return out;
}

Value read(std::string_view hex) {
  auto result = unarchivedObject(bytesOf(hex));
  EXPECT_TRUE(std::holds_alternative<Value>(result))
      << hex << ": " << std::get<Error>(result).localizedDescription;
  return std::holds_alternative<Value>(result) ? std::get<Value>(result) : Value("unreadable");
}

std::string fault(std::string_view hex) {
  auto result = unarchivedObject(bytesOf(hex));
  return std::holds_alternative<Error>(result) ? std::get<Error>(result).localizedDescription : "none";
}

TEST(KeyedArchive, WritesNumbersInTheirShortestForm) {
  EXPECT_EQ(hexOf(0), "00");
  EXPECT_EQ(hexOf(23), "17");
  EXPECT_EQ(hexOf(24), "1818");
  EXPECT_EQ(hexOf(255), "18ff");
  EXPECT_EQ(hexOf(256), "190100");
  EXPECT_EQ(hexOf(65536), "1a00010000");
  EXPECT_EQ(hexOf(1000000000000), "1b000000e8d4a51000");
  EXPECT_EQ(hexOf(std::numeric_limits<uint64_t>::max()), "1bffffffffffffffff");
  EXPECT_EQ(hexOf(-1), "20");
  EXPECT_EQ(hexOf(-1000), "3903e7");
  EXPECT_EQ(hexOf(std::numeric_limits<int64_t>::min()), "3b7fffffffffffffff");
  EXPECT_EQ(hexOf(1.1), "fb3ff199999999999a");
}

TEST(KeyedArchive, WritesEveryOtherKind) {
  EXPECT_EQ(hexOf(nullptr), "f6");
  EXPECT_EQ(hexOf(false), "f4");
  EXPECT_EQ(hexOf(true), "f5");
  EXPECT_EQ(hexOf("IETF"), "6449455446");
  EXPECT_EQ(hexOf("\u00fc"), "62c3bc");
  EXPECT_EQ(hexOf(Data(std::string_view("\x01\x02\x03\x04"))), "4401020304");
  EXPECT_EQ(hexOf(Date{1363896240}), "c11a514b67b0");
  EXPECT_EQ(hexOf(Date{1363896240.5}), "c1fb41d452d9ec200000");
  EXPECT_EQ(hexOf(Date{-1}), "c120");
  EXPECT_EQ(hexOf(Array{1, 2, 3}), "83010203");
  EXPECT_EQ(hexOf(Dictionary{{"b", 1}, {"a", Array{}}}), "a2616201616180");
}

// Beyond 2^53 not every whole number is a double.
TEST(KeyedArchive, WritesDatesAsIntegersOnlyWhereTheyAreExact) {
  EXPECT_EQ(hexOf(Date{9007199254740992.0}), "c11b0020000000000000");
  EXPECT_EQ(hexOf(Date{-9007199254740992.0}), "c13b001fffffffffffff");
  EXPECT_EQ(hexOf(Date{18014398509481984.0}), "c1fb4350000000000000");
  EXPECT_EQ(hexOf(Date{1e300}), "c1fb7e37e43c8800759c");
  EXPECT_EQ(hexOf(Date{-1e300}), "c1fbfe37e43c8800759c");
  EXPECT_EQ(hexOf(Date{std::numeric_limits<double>::infinity()}), "c1fb7ff0000000000000");
  EXPECT_EQ(hexOf(Date{std::numeric_limits<double>::quiet_NaN()}), "c1fb7ff8000000000000");
}

TEST(KeyedArchive, ReadsBackWhatItWrote) {
  Array items;
  for (int i = 0; i < 300; ++i)
    items.append(Dictionary{{"line", "entry " + std::to_string(i)}, {"level", i}});
  const Value value = Dictionary{{"entries", items},
                                 {"made", Date{1769860800.25}},
                                 {"raw", Data(std::string(300, '\xff'))},
                                 {"large", std::numeric_limits<uint64_t>::max()},
                                 {"small", std::numeric_limits<int64_t>::min()},
                                 {"real", -0.1},
                                 {"yes", true},
                                 {"nothing", nullptr}};
  const std::optional<Data> data = archivedData(value);
  ASSERT_TRUE(data);
  const auto result = unarchivedObject(data->view());
  ASSERT_TRUE(std::holds_alternative<Value>(result));
  const Value& back = std::get<Value>(result);
  EXPECT_EQ(back, value);
  EXPECT_EQ(back.dictionary()->find("made")->kind(), Value::Kind::date);
  EXPECT_EQ(back.dictionary()->find("raw")->kind(), Value::Kind::data);
  EXPECT_EQ(back.dictionary()->find("yes")->kind(), Value::Kind::boolean);
}

TEST(KeyedArchive, ReadsTheFormsThatOthersWrite) {
  EXPECT_EQ(read("f90001"), Value(5.960464477539063e-8));
  EXPECT_EQ(read("f93c00"), Value(1.0));
  EXPECT_EQ(read("f9c400"), Value(-4.0));
  EXPECT_EQ(read("f97bff"), Value(65504.0));
  EXPECT_TRUE(std::isinf(read("f97c00").doubleValue()));
  EXPECT_TRUE(std::isnan(read("f97e00").doubleValue()));
  EXPECT_EQ(read("fa47c35000"), Value(100000.0));
  EXPECT_EQ(read("1900ff"), Value(255));  // longer than it need be
  EXPECT_TRUE(read("f7").isNull());
  EXPECT_EQ(read("c1f93c00"), Value(Date{1}));
  EXPECT_EQ(read("a2616101616102"), Value(Dictionary{{"a", 2}}));  // of equal keys the last wins
}

TEST(KeyedArchive, RefusesWhatIsMalformed) {
  EXPECT_EQ(fault(""), "at byte 0: it ends too early");
  EXPECT_EQ(fault("19ff"), "at byte 0: it ends too early");
  EXPECT_EQ(fault("6261"), "at byte 1: it ends too early");
  EXPECT_EQ(fault("8201"), "at byte 1: it ends too early");
  EXPECT_EQ(fault("a16161"), "at byte 3: it ends too early");
  EXPECT_EQ(fault("0000"), "at byte 1: there is more after the object");
  EXPECT_EQ(fault("61ff"), "at byte 2: a text is no UTF-8");
  EXPECT_EQ(fault("a10101"), "at byte 2: a key is no text");
  EXPECT_EQ(fault("9f01ff"), "at byte 0: a length that is not given, or a reserved one");
  EXPECT_EQ(fault("1c"), "at byte 0: a length that is not given, or a reserved one");
  EXPECT_EQ(fault("3bffffffffffffffff"), "at byte 9: an integer is too small");
  EXPECT_EQ(fault("c001"), "at byte 1: an unknown tag");
  EXPECT_EQ(fault("c16131"), "at byte 3: a date is no number");
  EXPECT_EQ(fault("c1f5"), "at byte 2: a date is no number");
  EXPECT_EQ(fault("f8ff"), "at byte 2: an unknown simple value");
  EXPECT_EQ(fault("e0"), "at byte 1: an unknown simple value");
}

// Lengths are believed only as far as bytes are there.
TEST(KeyedArchive, AllocatesNothingForLengthsThatCannotBe) {
  EXPECT_EQ(fault("5bffffffffffffffff"), "at byte 9: it ends too early");
  EXPECT_EQ(fault("9affffffff"), "at byte 5: it ends too early");
  EXPECT_EQ(fault("bb7fffffffffffffff"), "at byte 9: it ends too early");
}

TEST(KeyedArchive, HasALimitOfDepth) {
  Value nested = 1;
  for (int depth = 1; depth < Limits::maxObjectDepth; ++depth) nested = Array{nested};
  std::string expected;
  for (int depth = 1; depth < Limits::maxObjectDepth; ++depth) expected += "81";
  EXPECT_EQ(hexOf(nested), expected + "01");
  EXPECT_FALSE(archivedData(Array{nested}));
  EXPECT_FALSE(archivedData(Dictionary{{"a", nested}}));
  std::string deep;
  for (int i = 0; i < 100000; ++i) deep += "81";
  EXPECT_EQ(fault(deep), "at byte 32: it is nested too deep");
  std::string tags;
  for (int i = 0; i < 100000; ++i) tags += "c1";
  EXPECT_EQ(fault(tags), "at byte 32: it is nested too deep");
}

TEST(KeyedArchive, RefusesTextThatIsNoUTF8) {
  EXPECT_FALSE(archivedData(Value("a\xff")));
  EXPECT_FALSE(archivedData(Dictionary{{"\xc3", 1}}));
}

}  // namespace
}  // namespace kyt
