#include "platform/objects/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Limits.h"

namespace kyt {
namespace {

std::string repeated(size_t size) {
  std::string text;
  for (size_t i = 0; i < size; ++i) text += static_cast<char>('a' + i % 26);
  return text;
}

TEST(String, KeepsTextOfEveryLengthAndItsTerminator) {
  for (size_t size = 0; size <= 40; ++size) {
    const std::string text = repeated(size);
    // From a block of exactly that size, so that a read past its end is noticed by the address sanitizer.
    const std::vector<char> exact(text.begin(), text.end());
    const String string(std::string_view(exact.data(), exact.size()));
    EXPECT_EQ(string.view(), text);
    EXPECT_EQ(string.size(), size);
    EXPECT_EQ(std::strlen(string.c_str()), size);
    EXPECT_EQ(string.block() != nullptr, size > 15) << size;
    const String copy(string);
    EXPECT_EQ(copy, string);
    EXPECT_EQ(copy.view(), text);
  }
}

TEST(String, ComparesShortAndLongText) {
  EXPECT_TRUE(String("abc") == String("abc"));
  EXPECT_FALSE(String("abc") == String("abd"));
  EXPECT_FALSE(String("abc") == String(std::string_view("abc\0", 4)));
  EXPECT_FALSE(String() == String(std::string_view("\0", 1)));
  EXPECT_TRUE(String(repeated(30)) == String(repeated(30)));
  EXPECT_FALSE(String(repeated(30)) == String(repeated(31)));
  EXPECT_TRUE(String("abc") == "abc");
}

TEST(String, AssignsToItselfAndFromItsOwnText) {
  String string(repeated(20));
  const String& same = string;
  string = same;
  EXPECT_EQ(string.view(), repeated(20));
  string = String(string.view().substr(0, 17));
  EXPECT_EQ(string.view(), repeated(17));
}

TEST(String, LeavesAnEmptyStringWhenMovedFrom) {
  String from(repeated(20));
  const String to(std::move(from));
  EXPECT_EQ(to.size(), 20U);
  EXPECT_TRUE(from.empty());  // NOLINT(bugprone-use-after-move): that is what is tested
}

TEST(String, CountsUTF16UnitsAndMalformedBytesAsOneEach) {
  EXPECT_EQ(String("").utf16Length(), 0U);
  EXPECT_EQ(String("abc").utf16Length(), 3U);
  EXPECT_EQ(String("\xC3\xA4\xE2\x82\xAC").utf16Length(), 2U);
  EXPECT_EQ(String("\xF0\x9F\x98\x80").utf16Length(), 2U);
  EXPECT_EQ(String("\xFF\xE2\x82").utf16Length(), 3U);
  EXPECT_EQ(String("a\xC3").utf16Length(), 2U);
}

TEST(String, OfPermanentTextSharesItsBlockWithoutCounting) {
  static const String key = String::permanent("a key of more than fifteen bytes");
  {
    const String copy(key);
    EXPECT_EQ(copy.block(), key.block());
  }
  EXPECT_EQ(key, "a key of more than fifteen bytes");
  EXPECT_EQ(String::permanent("short"), "short");  // lives inside, like every short text
}

TEST(Data, HoldsBytesAndMayBeCut) {
  EXPECT_EQ(Data().block(), nullptr);
  EXPECT_EQ(Data(std::string_view()).block(), nullptr);
  std::byte* bytes = nullptr;
  Data data = Data::uninitialized(5, bytes);
  std::memcpy(bytes, "hello", 5);
  EXPECT_EQ(data.view(), "hello");
  data.truncate(2);
  EXPECT_EQ(data, Data(std::string_view("he")));
  data.truncate(0);
  EXPECT_TRUE(data.empty());
}

TEST(Value, KeepsItsKind) {
  EXPECT_EQ(Value().kind(), Value::Kind::null);
  EXPECT_EQ(Value(nullptr).kind(), Value::Kind::null);
  EXPECT_EQ(Value(true).kind(), Value::Kind::boolean);
  EXPECT_EQ(Value(-1).kind(), Value::Kind::integer);
  EXPECT_EQ(Value(1U).kind(), Value::Kind::unsignedInteger);
  EXPECT_EQ(Value(1.5).kind(), Value::Kind::real);
  EXPECT_EQ(Value(Date{1}).kind(), Value::Kind::date);
  EXPECT_EQ(Value("a").kind(), Value::Kind::string);
  EXPECT_EQ(Value(repeated(20)).kind(), Value::Kind::string);
  EXPECT_EQ(Value(Data()).kind(), Value::Kind::data);
  EXPECT_EQ(Value(Array()).kind(), Value::Kind::array);
  EXPECT_EQ(Value(Dictionary()).kind(), Value::Kind::dictionary);
}

TEST(Value, AnswersItsObjectOnlyForItsOwnKind) {
  const Value number(7);
  EXPECT_EQ(number.integer(), 7);
  EXPECT_EQ(number.unsignedInteger(), std::nullopt);
  EXPECT_EQ(number.real(), std::nullopt);
  EXPECT_EQ(number.boolean(), std::nullopt);
  EXPECT_EQ(number.date(), std::nullopt);
  EXPECT_EQ(number.string(), nullptr);
  EXPECT_EQ(number.dictionary(), nullptr);
  const Value text(repeated(20));
  ASSERT_NE(text.string(), nullptr);
  EXPECT_EQ(text.string()->view(), repeated(20));
  EXPECT_EQ(text.data(), nullptr);
  EXPECT_EQ(text.array(), nullptr);
}

TEST(Value, CopiesAndMovesLongText) {
  Value a(repeated(40));
  Value b(a);
  EXPECT_EQ(a.block(), b.block());
  Value c;
  c = b;
  c = std::move(b);
  EXPECT_TRUE(b.isNull());  // NOLINT(bugprone-use-after-move): that is what is tested
  EXPECT_EQ(c, a);
  a = a.string()->view();
  EXPECT_EQ(c, a);
}

TEST(Value, BecomesItsOwnElement) {
  Value value(Array{Value(repeated(20)), 2});
  value = (*value.array())[0];
  EXPECT_EQ(value, Value(repeated(20)));
}

TEST(Value, ReadsNumbers) {
  EXPECT_EQ(Value(true).intValue(), 1);
  EXPECT_EQ(Value(-5).intValue(), -5);
  EXPECT_EQ(Value(-1).unsignedIntValue(), UINT32_MAX);
  EXPECT_EQ(Value(int64_t{0x100000007}).intValue(), 7);
  EXPECT_EQ(Value(UINT64_MAX).longLongValue(), -1);
  EXPECT_EQ(Value(-3.9).longLongValue(), -3);
  EXPECT_EQ(Value(1e30).longLongValue(), INT64_MAX);
  EXPECT_EQ(Value(-1e30).longLongValue(), INT64_MIN);
  EXPECT_EQ(Value(1e30).unsignedLongLongValue(), UINT64_MAX);
  EXPECT_EQ(Value(-1.0).unsignedLongLongValue(), 0U);
  EXPECT_EQ(Value(std::nan("")).longLongValue(), 0);
  EXPECT_EQ(Value(std::nan("")).unsignedLongLongValue(), 0U);
  EXPECT_EQ(Value(UINT64_MAX).doubleValue(), 18446744073709551616.0);
}

TEST(Value, ReadsWhatAStringBeginsWith) {
  EXPECT_EQ(Value(" \t\n-12abc").intValue(), -12);
  EXPECT_EQ(Value("+7").intValue(), 7);
  EXPECT_EQ(Value("- 7").intValue(), 0);
  EXPECT_EQ(Value("--7").intValue(), 0);
  EXPECT_EQ(Value("").intValue(), 0);
  EXPECT_EQ(Value("-").intValue(), 0);
  EXPECT_EQ(Value("abc").intValue(), 0);
  EXPECT_EQ(Value("4294967297").intValue(), 1);
  EXPECT_EQ(Value("99999999999999999999").longLongValue(), INT64_MAX);
  EXPECT_EQ(Value("99999999999999999999").intValue(), -1);
  EXPECT_EQ(Value("-99999999999999999999").longLongValue(), INT64_MIN);
  EXPECT_EQ(Value("-9223372036854775808").longLongValue(), INT64_MIN);
  EXPECT_EQ(Value("18446744073709551615").unsignedLongLongValue(), UINT64_MAX);
  EXPECT_EQ(Value("18446744073709551616").unsignedLongLongValue(), UINT64_MAX);
  EXPECT_EQ(Value("-1").unsignedIntValue(), UINT32_MAX);
}

TEST(Value, ReadsADoubleFromAString) {
  EXPECT_EQ(Value(" -2.5x").doubleValue(), -2.5);
  EXPECT_EQ(Value("1e3").doubleValue(), 1000);
  EXPECT_EQ(Value(".5").doubleValue(), .5);
  EXPECT_EQ(Value("inf").doubleValue(), 0);
  EXPECT_EQ(Value("nan").doubleValue(), 0);
  EXPECT_EQ(Value("+-3").doubleValue(), 0);
  EXPECT_EQ(Value("1e999").doubleValue(), HUGE_VAL);
  EXPECT_EQ(Value("-1e999").doubleValue(), -HUGE_VAL);
  EXPECT_EQ(Value("1e-999").doubleValue(), 0);
}

TEST(Value, ReadsTheTruthOfAStringFromItsFirstSignificantCharacter) {
  for (const char* text : {"1", "9", "T", "true", "Yes", "y", " \t1", "-1", "+001", "00t", " -0Y"})
    EXPECT_TRUE(Value(text).boolValue()) << text;
  for (const char* text : {"", "0", "000", "no", "false", "+", " -0", "x1", "- 1", "on"})
    EXPECT_FALSE(Value(text).boolValue()) << text;
}

TEST(Value, ReadsTheTruthOfANumberAsNotZero) {
  EXPECT_TRUE(Value(-1).boolValue());
  EXPECT_TRUE(Value(0.1).boolValue());
  EXPECT_FALSE(Value(0).boolValue());
  EXPECT_FALSE(Value(-0.0).boolValue());
  EXPECT_FALSE(Value(false).boolValue());
}

TEST(Value, ReadsDatesDataAndContainersAsZero) {
  for (const Value& value : {Value(Date{5}), Value(Data(std::string_view("1"))), Value(Array{1}),
                             Value(Dictionary{{"1", 1}}), Value()}) {
    EXPECT_EQ(value.longLongValue(), 0);
    EXPECT_EQ(value.unsignedLongLongValue(), 0U);
    EXPECT_EQ(value.doubleValue(), 0);
    EXPECT_FALSE(value.boolValue());
  }
}

TEST(Value, ComparesNumbersByValueAcrossKinds) {
  EXPECT_EQ(Value(1), Value(1.0));
  EXPECT_EQ(Value(1U), Value(true));
  EXPECT_EQ(Value(0.0), Value(false));
  EXPECT_EQ(Value(-0.0), Value(0));
  EXPECT_FALSE(Value(-1) == Value(UINT64_MAX));
  EXPECT_FALSE(Value(-1.0) == Value(UINT64_MAX));
  EXPECT_EQ(Value(-1.0), Value(-1));
  EXPECT_EQ(Value(INT64_MIN), Value(-9223372036854775808.0));
  EXPECT_FALSE(Value(INT64_MAX) == Value(9223372036854775808.0));
  EXPECT_FALSE(Value(UINT64_MAX) == Value(18446744073709551616.0));
  EXPECT_FALSE(Value(1) == Value(1.5));
  EXPECT_FALSE(Value(1) == Value("1"));
  EXPECT_FALSE(Value(1.0) == Value(Date{1}));
  EXPECT_EQ(Value(Date{1}), Value(Date{1}));
  EXPECT_EQ(Value(), Value());
}

TEST(Array, CopiesItsEntriesOnTheFirstChangeOfASharedBlock) {
  Array a{1, "two", repeated(20)};
  Array b(a);
  EXPECT_EQ(a.block(), b.block());
  b.append(4);
  EXPECT_NE(a.block(), b.block());
  EXPECT_EQ(a.size(), 3U);
  EXPECT_EQ(b.size(), 4U);
  EXPECT_EQ(a[2].block(), b[2].block());
  b.mutableBegin()[0] = 9;
  EXPECT_EQ(a[0], Value(1));
  b.removeAt(2);
  EXPECT_EQ(b, (Array{9, "two", 4}));
  EXPECT_EQ(a, (Array{1, "two", repeated(20)}));
}

TEST(Array, GrowsAndAppendsItself) {
  Array array;
  EXPECT_EQ(array.block(), nullptr);
  for (int i = 0; i < 1000; ++i) array.append(i);
  Array copy(array);
  copy.append(array);
  ASSERT_EQ(copy.size(), 1001U);
  EXPECT_EQ(*copy[1000].array(), array);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(array[static_cast<size_t>(i)].integer(), i);
}

TEST(Value, ReleasesTheDeepestObjectThatTheWireAllows) {
  Value value(repeated(20));
  for (int depth = 0; depth < Limits::maxIPCDepth; ++depth)
    value = depth % 2 == 0 ? Value(Array{value}) : Value(Dictionary{{"inner", value}});
  const Value* innermost = &value;
  int depth = 0;
  while (innermost->isArray() || innermost->isDictionary()) {
    innermost = innermost->isArray() ? innermost->array()->begin() : innermost->dictionary()->find("inner");
    ++depth;
  }
  EXPECT_EQ(depth, 64);
  EXPECT_EQ(*innermost, Value(repeated(20)));
  value = Value();
  EXPECT_TRUE(value.isNull());
}

TEST(Value, SharesBlocksBetweenThreads) {
  static const String constant = String::permanent("a permanent key of some length");
  Dictionary shared{
      {"text", repeated(40)}, {"list", Array{1, repeated(20), 3}}, {constant, Dictionary{{"a", 1}}}};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([own = shared, t]() mutable {
      for (int i = 0; i < 2000; ++i) {
        Dictionary copy(own);
        copy.set("thread", t);
        Value list(*copy.find("list"));
        list.mutableArray()->append(repeated(30));
        copy.set("list", list);
        ASSERT_EQ(copy.find("list")->array()->size(), 4U);
        ASSERT_EQ(own.find("list")->array()->size(), 3U);
        ASSERT_NE(copy.find(constant), nullptr);
        if (i % 100 == 0) own = Dictionary(copy), own.set("list", Array{1, repeated(20), 3});
      }
    });
  }
  shared = Dictionary();
  for (std::thread& thread : threads) thread.join();
}

}  // namespace
}  // namespace kyt
