// What becomes of bodies that are hostile, odd or only unusual.
#include "platform/ipc/BodyReader.h"

#include <gtest/gtest.h>

#include "WireTestSupport.h"
#include "platform/ipc/BodyValidator.h"

namespace kyt {
namespace {

using test::fromHex;

Message messageOf(std::string_view signature, std::string_view body) {
  Message message;
  message.signature = signature;
  message.body = test::bytesOf(body);
  return message;
}

// Reads an `av` of none or one, in little-endian bytes.
BodyStatus readOne(std::string_view body, Value& out) {
  const Message message = messageOf("av", body);
  BodyReader reader(message);
  reader.readOptionalValue(out);
  const BodyStatus status = reader.finish();
  EXPECT_EQ(status != BodyStatus::malformed, validateBody(message)) << reader.problem();
  return status;
}

// A body of one variant: signature and value as they stand in the bytes.
std::string variant(std::string_view signature, std::string_view valueHex) {
  std::string body(4, '\0');
  body.push_back(static_cast<char>(signature.size()));
  body.append(signature).push_back('\0');
  body += fromHex(valueHex);
  body[0] = static_cast<char>(body.size() - 4);
  return body;
}

TEST(BodyReader, TakesEveryBasicType) {
  Value v;
  EXPECT_EQ(readOne(variant("y", "ff"), v), BodyStatus::ok);
  EXPECT_EQ(v.unsignedInteger(), 255u);
  EXPECT_EQ(readOne(variant("b", "00 01000000"), v), BodyStatus::ok);
  EXPECT_EQ(v.boolean(), true);
  EXPECT_EQ(readOne(variant("n", "00 feff"), v), BodyStatus::ok);
  EXPECT_EQ(v.integer(), -2);
  EXPECT_EQ(readOne(variant("q", "00 feff"), v), BodyStatus::ok);
  EXPECT_EQ(v.unsignedInteger(), 0xFFFEu);
  EXPECT_EQ(readOne(variant("i", "00 feffffff"), v), BodyStatus::ok);
  EXPECT_EQ(v.integer(), -2);
  EXPECT_EQ(readOne(variant("u", "00 feffffff"), v), BodyStatus::ok);
  EXPECT_EQ(v.unsignedInteger(), 0xFFFFFFFEu);
  EXPECT_EQ(readOne(variant("x", "00 feffffffffffffff"), v), BodyStatus::ok);
  EXPECT_EQ(v.integer(), -2);
  EXPECT_EQ(readOne(variant("t", "00 feffffffffffffff"), v), BodyStatus::ok);
  EXPECT_EQ(v.unsignedInteger(), ~uint64_t{1});
  EXPECT_EQ(readOne(variant("d", "00 000000000000f03f"), v), BodyStatus::ok);
  EXPECT_EQ(v.real(), 1.0);
  EXPECT_EQ(readOne(variant("s", "00 02000000 6162 00"), v), BodyStatus::ok);
  EXPECT_EQ(*v.string(), "ab");
  EXPECT_EQ(readOne(variant("o", "00 02000000 2f62 00"), v), BodyStatus::ok);
  EXPECT_EQ(*v.string(), "/b");
  EXPECT_EQ(readOne(variant("g", "02 6173 00"), v), BodyStatus::ok);
  EXPECT_EQ(*v.string(), "as");
}

TEST(BodyReader, TakesContainers) {
  Value v;
  EXPECT_EQ(readOne(variant("ay", "03000000 010203"), v), BodyStatus::ok) << "padding";
  EXPECT_EQ(v.data()->size(), 3u);
  EXPECT_EQ(readOne(variant("(d)", "0000 0000 0000 000000000000f03f").substr(0), v), BodyStatus::malformed)
      << "one byte of padding too few or many";
  // at 4: length 3, "(d)", NUL = 9; aligned to 16
  EXPECT_EQ(readOne(variant("(d)", "00000000000000 000000000000f03f"), v), BodyStatus::ok);
  EXPECT_EQ(v.date(), Date{1.0});
  EXPECT_EQ(readOne(variant("ai", "04000000 05000000"), v), BodyStatus::ok);
  EXPECT_EQ(*v.array(), Array{5});
  EXPECT_EQ(readOne(variant("aq", "04000000 0500 0600"), v), BodyStatus::ok);
  EXPECT_EQ(*v.array(), (Array{5, 6}));
  EXPECT_EQ(readOne(variant("as", "0a000000 01000000 6100 0000 00000000 00").substr(0), v),
            BodyStatus::malformed);
  EXPECT_EQ(readOne(variant("as", "0d000000 01000000 6100 0000 00000000 00"), v), BodyStatus::ok);
  EXPECT_EQ(*v.array(), (Array{"a", ""}));
  EXPECT_EQ(readOne(variant("a{si}", "0000 0c000000 01000000 6100 0000 07000000").substr(0), v),
            BodyStatus::malformed);
  // "a{si}" ends at 10 with its NUL: one byte of padding, length at 12, entries at 16
  EXPECT_EQ(readOne(variant("a{si}", "00 0c000000 01000000 6100 0000 07000000"), v), BodyStatus::ok);
  EXPECT_EQ(*v.dictionary(), (Dictionary{{"a", 7}}));
  EXPECT_EQ(readOne(variant("v", "01 79 00 09"), v), BodyStatus::ok);
  EXPECT_EQ(v.unsignedInteger(), 9u);
}

TEST(BodyReader, WhatNoObjectCanHoldIsInvalidArguments) {
  Value v;
  EXPECT_EQ(readOne(variant("h", "00 00000000"), v), BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(variant("ah", "00000000"), v), BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(variant("(i)", "00000000000000 01000000"), v), BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(variant("(dd)", "000000000000 0000000000000000 0000000000000000"), v),
            BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(variant("a(ii)", "00 00000000"), v), BodyStatus::invalidArguments)
      << "empty, but of structs";
  EXPECT_EQ(readOne(variant("a{is}", "00 00000000"), v), BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(variant("a{sh}", "00 00000000"), v), BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(variant("v", "01 68 00 0000 00000000"), v), BodyStatus::invalidArguments);
  EXPECT_TRUE(v.isNull());
}

TEST(BodyReader, InvalidArgumentsAreMalformedWhenTheRestOfTheBodyIs) {
  Value v;
  EXPECT_EQ(readOne(variant("h", "00 000000"), v), BodyStatus::malformed);
  EXPECT_EQ(readOne(variant("h", "01 00000000"), v), BodyStatus::malformed) << "padding";
  EXPECT_EQ(readOne(variant("(ib)", "000000000000 01000000 02000000"), v), BodyStatus::malformed)
      << "boolean 2";
  EXPECT_EQ(readOne(variant("h", "00 00000000 7a"), v), BodyStatus::malformed)
      << "an element that is no variant";
  EXPECT_EQ(readOne(variant("h", "00 00000000") + "x", v), BodyStatus::malformed) << "a byte too many";
}

TEST(BodyReader, OtherTypesThanTheMethodsAreInvalidOrMalformed) {
  for (const auto& [body, expected] : {std::pair(fromHex("01000000"), BodyStatus::invalidArguments),
                                       std::pair(fromHex("010000"), BodyStatus::malformed),
                                       std::pair(std::string(), BodyStatus::malformed)}) {
    const Message message = messageOf("i", body);
    BodyReader reader(message);
    EXPECT_FALSE(reader.hasSignature("u"));
    EXPECT_EQ(reader.finish(), expected);
  }
  const Message none = messageOf("", "");
  BodyReader reader(none);
  EXPECT_FALSE(reader.hasSignature("u"));
  EXPECT_EQ(reader.finish(), BodyStatus::invalidArguments);
}

TEST(BodyReader, MoreThanOneWhereNoneOrOneIsMeantIsInvalidArguments) {
  Value v;
  EXPECT_EQ(readOne(fromHex("08000000 01790001 01790002"), v), BodyStatus::invalidArguments);
  EXPECT_EQ(readOne(fromHex("07000000 01790001 017900"), v), BodyStatus::malformed);
}

TEST(BodyReader, RefusesWhatIsMalformed) {
  Value v;
  for (const auto& [what, body] : {
           std::pair("boolean 2", variant("b", "00 02000000")),
           std::pair("padding", variant("i", "01 02000000")),
           std::pair("no terminator", variant("s", "00 02000000 616263")),
           std::pair("NUL inside", variant("s", "00 02000000 6100 00")),
           std::pair("not UTF-8", variant("s", "00 02000000 c328 00")),
           std::pair("a surrogate", variant("s", "00 03000000 eda080 00")),
           std::pair("overlong", variant("s", "00 02000000 c0af 00")),
           std::pair("above U+10FFFF", variant("s", "00 04000000 f4908080 00")),
           std::pair("not a path", variant("o", "00 02000000 6162 00")),
           std::pair("a path's last slash", variant("o", "00 03000000 2f612f 00")),
           std::pair("not a signature", variant("g", "02 6161 00")),
           std::pair("an unknown type", variant("z", "00")),
           std::pair("no type", variant("", "00")),
           std::pair("two types", variant("yy", "0000")),
           std::pair("an entry alone", variant("{sv}", "00000000")),
           std::pair("a key that is no basic type", variant("a{vs}", "00000000")),
           std::pair("an empty struct", variant("()", "00000000")),
           std::pair("an array past the end", variant("ay", "05000000 010203")),
           std::pair("a huge array", variant("ay", "ffffffff 010203")),
           std::pair("an element past its array", variant("ai", "02000000 01000000")),
       }) {
    EXPECT_EQ(readOne(body, v), BodyStatus::malformed) << what;
  }
}

TEST(BodyReader, NestsSixtyFourDeepAndNoDeeper) {
  for (const auto& [variants, expected] :
       {std::pair(63, BodyStatus::ok), std::pair(64, BodyStatus::malformed)}) {
    std::string body(4, '\0');
    for (int i = 1; i < variants; ++i) body += std::string("\1v\0", 3);
    body += std::string("\1y\0\7", 4);
    const auto length = static_cast<uint32_t>(body.size() - 4);
    std::memcpy(body.data(), &length, 4);
    Value v;
    EXPECT_EQ(readOne(body, v), expected) << variants;
    if (expected == BodyStatus::ok) {
      EXPECT_EQ(v.unsignedInteger(), 7u);
    }
  }
}

TEST(BodyReader, OfEqualKeysTheLastWinsInThePlaceOfTheFirst) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(1, {.member = "M", .signature = "a{sv}"});
  writer.writeDictionary({{"one", 1},
                          {"two", 2},
                          {"owe", 3},
                          {"a key of more than 15 bytes", 4},
                          {"a_key of more than 15 bytes", 5}});
  ASSERT_TRUE(writer.end());
  bytes.replace(bytes.find("owe"), 3, "one");
  bytes.replace(bytes.find("a_key"), 5, "a key");
  Message message;
  ASSERT_EQ(test::frame(bytes, message).status, FrameStatus::complete);
  BodyReader reader(message);
  Dictionary dictionary;
  ASSERT_TRUE(reader.readDictionary(dictionary));
  EXPECT_EQ(reader.finish(), BodyStatus::ok);
  EXPECT_EQ(dictionary.size(), 3u);
  EXPECT_EQ(*dictionary.find("one"), Value(3));
  EXPECT_EQ(*dictionary.find("a key of more than 15 bytes"), Value(5));
  EXPECT_EQ(dictionary.begin()->key, "one");
}

TEST(BodyReader, LargeDictionariesKeepOrderAndLastValues) {
  Dictionary large;
  for (int i = 0; i < 1000; ++i) large.set("key " + std::to_string(i), i);
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(1, {.member = "M", .signature = "a{sv}"});
  writer.writeDictionary(large);
  ASSERT_TRUE(writer.end());
  bytes.replace(bytes.find("key 999"), 7, "key 500");
  Message message;
  ASSERT_EQ(test::frame(bytes, message).status, FrameStatus::complete);
  BodyReader reader(message);
  Dictionary dictionary;
  ASSERT_TRUE(reader.readDictionary(dictionary));
  EXPECT_EQ(dictionary.size(), 999u);
  EXPECT_EQ(*dictionary.find("key 500"), Value(999));
  EXPECT_EQ(dictionary.begin()->key, "key 0");
}

TEST(BodyReader, NamesNoMoreDescriptorsThanAMessageMayCarry) {
  for (const auto& [count, expected] :
       {std::pair(16u, BodyStatus::ok), std::pair(17u, BodyStatus::invalidArguments)}) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(1, {.member = "M", .signature = "ah"});
    writer.writeDescriptorIndexes(count);
    ASSERT_TRUE(writer.end());
    Message message;
    ASSERT_EQ(test::frame(bytes, message).status, FrameStatus::complete);
    BodyReader reader(message);
    std::vector<uint32_t> indexes;
    reader.readDescriptorIndexes(indexes);
    EXPECT_EQ(reader.finish(), expected);
  }
}

}  // namespace
}  // namespace kyt
