#include "platform/linux/data/RapidJSON.h"

#include <gtest/gtest.h>
#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <cmath>
#include <iterator>
#include <random>
#include <string>

#include "platform/base/JSONLayout.h"

namespace kyt {
namespace {

std::string compact(const Value& value) {
  std::string out;
  RapidJSON().writeCompact(value, out);
  return out;
}

std::string pretty(const Value& value) {
  std::string out;
  RapidJSON().writePretty(value, out);
  return out;
}

Value parsed(std::string_view text) {
  auto result = RapidJSON().parse(text);
  if (const Error* error = std::get_if<Error>(&result)) {
    ADD_FAILURE() << error->localizedDescription << " in " << text;
    return {};
  }
  return std::get<Value>(result);
}

std::string errorOf(std::string_view text) {
  auto result = RapidJSON().parse(text);
  const Error* error = std::get_if<Error>(&result);
  if (error == nullptr) return "no error";
  EXPECT_EQ(error->domain, kJSONErrorDomain);
  return error->localizedDescription;
}

TEST(JSON, WritesEveryKindInEnumerationOrder) {
  EXPECT_EQ(compact(Dictionary{{"z", 1},
                               {"a", Array{true, false, Value(), -5, UINT64_MAX, "t"}},
                               {"e", Dictionary()},
                               {"l", Array()},
                               {"r", 2.5}}),
            R"({"z":1,"a":[true,false,null,-5,18446744073709551615,"t"],"e":{},"l":[],"r":2.5})");
  EXPECT_EQ(compact("alone"), "\"alone\"");
  EXPECT_EQ(compact(INT64_MIN), "-9223372036854775808");
}

TEST(JSON, WritesWhatItCannotCarryAsNull) {
  EXPECT_EQ(compact(Array{HUGE_VAL, -HUGE_VAL, std::nan(""), Date{1}, Data(std::string_view("a")), Value()}),
            "[null,null,null,null,null,null]");
}

TEST(JSON, AppendsToWhatIsThere) {
  std::string out = "x=";
  RapidJSON().writeCompact(Array{1}, out);
  RapidJSON().writePretty(2, out);
  EXPECT_EQ(out, "x=[1]2");
}

TEST(JSON, WritesPrettyTextWithFourBlanksALevel) {
  EXPECT_EQ(
      pretty(Dictionary{{"a", Array{1, Dictionary{{"b", 0.5}}}}, {"c", Dictionary()}}),
      "{\n    \"a\": [\n        1,\n        {\n            \"b\": 0.5\n        }\n    ],\n    \"c\": {}\n}");
}

TEST(JSON, WritesDoublesAsTheShortestDecimalThatReadsBackTheSame) {
  EXPECT_EQ(compact(Array{0.1, 1409443200.123456, 100000.0, 1e21, 1e-7, 5e-324, -0.0, 5.0, 0.3}),
            "[0.1,1409443200.123456,100000,1e+21,1e-07,5e-324,-0,5,0.3]");
  std::mt19937_64 random(7);
  for (int i = 0; i < 20000; ++i) {
    const double number = std::bit_cast<double>(random());
    if (!std::isfinite(number)) continue;
    const std::string text = compact(number);
    ASSERT_EQ(parsed(text).doubleValue(), number) << text;
    ASSERT_EQ(text, decimalText(number));
  }
}

TEST(JSON, EscapesTextsOfEveryLengthAsRapidJSONDoes) {
  std::mt19937 random(11);
  for (size_t length = 0; length < 9000; length += length < 40 ? 1 : 613) {
    for (const unsigned escapes : {0U, 7U, 1U}) {  // none, one in seven, all
      std::string text;
      for (size_t i = 0; i < length; ++i)
        text += escapes != 0 && random() % escapes == 0 ? "\"\\\n\r\t\b\f\x01\x1F\x10"[random() % 10]
                                                        : static_cast<char>(0x20 + random() % 0x60);
      if (escapes == 0) std::erase_if(text, [](char c) { return c == '"' || c == '\\'; });
      rapidjson::StringBuffer buffer;
      rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
      writer.String(text.data(), static_cast<rapidjson::SizeType>(text.size()));
      ASSERT_EQ(compact(text), std::string_view(buffer.GetString(), buffer.GetSize()));
      ASSERT_EQ(parsed(compact(text)), Value(text));
    }
  }
  EXPECT_EQ(compact(std::string_view("\0", 1)), "\"\\u0000\"");
  EXPECT_EQ(compact("\xC3\xA4\x7F/\xF0\x9F\x98\x80"), "\"\xC3\xA4\x7F/\xF0\x9F\x98\x80\"");
}

TEST(JSON, WritesDeeperThanItsUsualDepth) {
  Value value(1);
  for (int i = 0; i < 200; ++i) value = Value(Array{value});
  EXPECT_EQ(compact(value), std::string(200, '[') + "1" + std::string(200, ']'));
}

TEST(JSON, ReadsNumbersWithTheirKind) {
  EXPECT_EQ(parsed("7").integer(), 7);
  EXPECT_EQ(parsed("-7").integer(), -7);
  EXPECT_EQ(parsed("4294967295").integer(), 4294967295);
  EXPECT_EQ(parsed("-9223372036854775808").integer(), INT64_MIN);
  EXPECT_EQ(parsed("9223372036854775807").integer(), INT64_MAX);
  EXPECT_EQ(parsed("18446744073709551615").unsignedInteger(), UINT64_MAX);
  EXPECT_EQ(parsed("18446744073709551616").real(), 18446744073709551616.0);
  EXPECT_EQ(parsed("-9223372036854775809").real(), -9223372036854775808.0);
  EXPECT_EQ(parsed("1.0").real(), 1.0);
  EXPECT_EQ(parsed("0e47").real(), 0);  // undefined in RapidJSON's own conversion
  EXPECT_EQ(parsed("1e-999").real(), 0);
  EXPECT_EQ(parsed("5e-324").real(), 5e-324);
}

TEST(JSON, ReadsBackWhatItWrote) {
  const Value value(
      Dictionary{{"a", Array{1, -2, 0.1, "x\n\"", true, Value()}}, {"b", Dictionary{{"c", Array()}}}});
  EXPECT_EQ(parsed(compact(value)), value);
  EXPECT_EQ(parsed(pretty(value)), value);
}

TEST(JSON, LetsTheLastOfEqualKeysWin) {
  EXPECT_EQ(parsed(R"({"a":1,"a":2})"), Value(Dictionary{{"a", 2}}));
}

TEST(JSON, RefusesWhatIsNoJSONAndSaysWhere) {
  EXPECT_EQ(errorOf("[1e999]"), "Number too big to be stored in double. (offset 1)");
  EXPECT_EQ(errorOf("[1,"), "Invalid value. (offset 3)");
  EXPECT_EQ(errorOf(""), "The document is empty. (offset 0)");
  for (std::string_view text :
       {"{", "[1]]", "{\"a\"}", "01", "nan", "\"\xFF\"", "\"\\uD800\"", "1e999", "[1,]", "'a'"})
    EXPECT_NE(errorOf(text), "no error") << text;
  EXPECT_EQ(errorOf(std::string_view("1\0]", 3)), "Invalid value. (offset 1)");
}

TEST(JSON, LimitsDepth) {
  EXPECT_EQ(parsed(std::string(32, '[') + std::string(32, ']')).kind(), Value::Kind::array);
  EXPECT_EQ(errorOf(std::string(33, '[') + std::string(33, ']')),
            "Containers are nested too deep. (offset 33)");
  EXPECT_NE(errorOf(std::string(1000000, '[')), "no error");
}

TEST(RapidJSON, RefusesEscapedSurrogatesThatStandAlone) {
  RapidJSON json;
  for (const char* text : {R"(["\uDDDD"])", R"(["\uD800"])", R"({"\uDC00": 1})", R"(["\uD800\uD800"])"})
    EXPECT_TRUE(std::holds_alternative<Error>(json.parse(text))) << text;
  EXPECT_EQ(std::get<Value>(json.parse(R"(["\uD83D\uDE00"])")), Value(Array{"\xF0\x9F\x98\x80"}));
}

// Of any kind, texts with what is escaped among them.
Value anything(std::mt19937& random, int depth) {
  static constexpr std::string_view kPieces[] = {"a", "\"", "\\", "\n",   "{",        "}",         "[",
                                                 "]", ",",  ":",  "\x01", "\xC3\xBC", "0123456789"};
  const auto text = [&] {
    std::string made;
    for (size_t left = random() % 12; left != 0; --left) made += kPieces[random() % std::size(kPieces)];
    return made;
  };
  switch (random() % (depth < 4 ? 8 : 6)) {
    case 0:
      return Value();
    case 1:
      return Value(random() % 2 == 0);
    case 2:
      return Value(static_cast<int64_t>(random()) - 2000000000);
    case 3:
      return Value(static_cast<double>(random()) * 1e300);
    case 4:
      return Value(static_cast<double>(random()) / 7);
    case 5:
      return Value(text());
    case 6: {
      Array array;
      for (size_t left = random() % 5; left != 0; --left) array.append(anything(random, depth + 1));
      return Value(std::move(array));
    }
    default: {
      Dictionary dictionary;
      for (size_t left = random() % 5; left != 0; --left) dictionary.set(text(), anything(random, depth + 1));
      return Value(std::move(dictionary));
    }
  }
}

TEST(RapidJSON, LaysOutAsTheLayoutOfItsCompactText) {
  std::mt19937 random(5);
  for (int i = 0; i < 3000; ++i) {
    const Value value = anything(random, 0);
    std::string laidOut;
    appendLaidOutJSON(laidOut, compact(value));
    ASSERT_EQ(laidOut, pretty(value)) << compact(value);
  }
}

// Records as back ends make them: mostly the entries of the one before, among others that come and go.
TEST(RapidJSON, WritesWhatRecordsHaveInCommonAsItWritesEachAlone) {
  std::mt19937 random(6);
  for (int round = 0; round < 300; ++round) {
    Array records;
    Dictionary record;
    for (int i = 0; i < 12; ++i) {
      for (size_t changes = random() % 4; changes != 0; --changes) {
        const std::string key = "a key that has a block of its own " + std::to_string(random() % 20);
        if (random() % 3 == 0)
          record.remove(key);
        else if (random() % 10 == 0)
          record.set(key, std::string(random() % 9000, 'x'));
        else
          record.set(key, anything(random, 2));
      }
      if (random() % 4 == 0) record.set("k" + std::to_string(random() % 5), static_cast<int>(random() % 3));
      records.append(random() % 15 == 0 ? anything(random, 3) : Value(record));
    }
    std::string alone = "[";
    for (const Value& each : records) alone += (alone.size() > 1 ? "," : "") + compact(each);
    ASSERT_EQ(compact(records), alone + "]");
  }
}

TEST(RapidJSON, AppendsRecordsToWhatIsThere) {
  const Dictionary record{{"a longer key than is kept inside", "a longer text than is kept inside"},
                          {"k", 1}};
  std::string out = "before ";
  RapidJSON().writeCompact(Array{record, record, Dictionary(), record}, out);
  EXPECT_EQ(out, "before [" + compact(record) + "," + compact(record) + ",{}," + compact(record) + "]");
}

}  // namespace
}  // namespace kyt
