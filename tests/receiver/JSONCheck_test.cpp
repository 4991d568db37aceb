#include "receiver/JSONCheck.h"

#include <gtest/gtest.h>

#include "receiver/Limits.h"
#include "tests/receiver/ReceiverProcess.h"

namespace kyt::receiver {
namespace {

std::string problemOf(const std::string& text) {
  const auto plain = problemOfPost(text, false);
  const auto compressed = problemOfPost(gzipped(text), true);
  EXPECT_EQ(plain.has_value(), compressed.has_value()) << text;
  if (plain && compressed) {
    EXPECT_EQ(plain->text, compressed->text);
    EXPECT_FALSE(plain->isGzip);
    EXPECT_FALSE(compressed->isGzip);
  }
  return plain ? plain->text : "";
}

TEST(PostsJSON, IsTakenAsTheDaemonSendsIt) {
  EXPECT_EQ(problemOf(postText(1)), "");
  EXPECT_EQ(problemOf(R"({"postTime":1.5,"clientId":"d","events":[]})"), "");
  EXPECT_EQ(problemOf(R"({"events":[{"a":1,"b":"x","c":true,"d":-1.5e3},{}],"more":{"deep":[[1,null]]}})"),
            "");
  EXPECT_EQ(problemOf("{}\n"), "") << "without an identifier there are no events";
  EXPECT_EQ(problemOf("{\"events\":[{\"a\":\"" + std::string(200000, 'x') + "\"}]}"), "")
      << "over several blocks";
}

TEST(PostsJSON, OfMoreBytesThanAreToBeLookedAtIsNotJudged) {
  for (const bool isGzip : {false, true}) {
    const auto lookAt = [&](const std::string& text, uint64_t most) {
      return lookAtPost(isGzip ? gzipped(text) : text, isGzip, most);
    };
    const std::string good = postText(1, 100000), bad = "[" + good;
    EXPECT_TRUE(lookAt(good, good.size() - 1).hasMore);
    EXPECT_FALSE(lookAt(good, good.size() - 1).problem);
    EXPECT_FALSE(lookAt(good, good.size()).hasMore);
    EXPECT_FALSE(lookAt(good, good.size()).problem);
    EXPECT_TRUE(lookAt(bad, bad.size()).problem);
    EXPECT_FALSE(lookAt(bad, bad.size()).hasMore);
  }
}

TEST(PostsJSON, IsRefusedInAnyOtherShape) {
  EXPECT_EQ(problemOf("[]"), "the message is no object");
  EXPECT_EQ(problemOf("1"), "the message is no object");
  EXPECT_EQ(problemOf(R"({"events":{}})"), "\"events\" is no array");
  EXPECT_EQ(problemOf(R"({"events":1})"), "\"events\" is no array");
  EXPECT_EQ(problemOf(R"({"events":[1]})"), "an entry of \"events\" is no object");
  EXPECT_EQ(problemOf(R"({"events":[[]]})"), "an entry of \"events\" is no object");
  EXPECT_EQ(problemOf(R"({"events":[{"a":null}]})"), "a value of a record is null");
  EXPECT_EQ(problemOf(R"({"events":[{"a":{}}]})"), "a value of a record is no string, number or boolean");
  EXPECT_EQ(problemOf(R"({"events":[{"a":[]}]})"), "a value of a record is no string, number or boolean");
  EXPECT_EQ(problemOf("{\"a\":" + std::string(32, '[') + std::string(32, ']') + "}"),
            "the JSON is nested too deeply");
  EXPECT_EQ(problemOf("{\"a\":" + std::string(31, '[') + std::string(31, ']') + "}"), "");
}

TEST(PostsJSON, IsRefusedWhereItIsMalformed) {
  EXPECT_NE(problemOf(R"({"events":[{"a":1})"), "");
  EXPECT_NE(problemOf("{} {}"), "");
  EXPECT_NE(problemOf("{\"a\":\"\xff\"}"), "");
  EXPECT_NE(problemOf(""), "");
  EXPECT_EQ(problemOf(std::string("{}\0{}", 5)), "the JSON ends before the body");
}

// That gzip makes half as long.
std::string letters(size_t count) {
  std::string text(count, ' ');
  uint32_t number = 1;
  for (char& c : text) c = static_cast<char>('a' + ((number = number * 1664525 + 1013904223) >> 24) % 16);
  return text;
}

TEST(PostsJSON, IsRefusedAsSoonAsAStringIsTooLongToBeCollected) {
  const std::string most = letters(Limits::maxJSONStringBytes);
  EXPECT_EQ(problemOf("{\"events\":[{\"a\":\"" + most + "\",\"" + most + "\":1}]}"), "");
  EXPECT_EQ(problemOf("{\"events\":[{\"a\":\"" + most + "x\"}]}"), "a string is too long");
  EXPECT_EQ(problemOf("{\"events\":[{\"" + most + "x\":1}]}"), "a string is too long") << "a key";
  EXPECT_EQ(problemOf("{\"a\":\"\\\\\",\"b\":\"\\\"" + most + "\"}"), "a string is too long")
      << "a quote that is escaped ends none";
  EXPECT_EQ(problemOf("{\"a\":\"\\\\\"," + std::string(Limits::maxJSONStringBytes / 8, ' ') + "\"b\":\"" +
                      most.substr(2) + "\\\"\"}"),
            "");
  // What follows is not looked at.
  EXPECT_EQ(problemOf("{\"a\":\"" + most + "x"), "a string is too long");
}

TEST(PostsGzip, IsRefusedWhereItIsDamagedOrCutOrFollowed) {
  const std::string good = gzipped(postText(1, 5000));
  ASSERT_FALSE(problemOfPost(good, true));
  for (size_t size = 0; size < good.size(); ++size) {
    const auto problem = problemOfPost(good.substr(0, size), true);
    ASSERT_TRUE(problem) << size;
    EXPECT_TRUE(problem->isGzip) << size;
  }
  const auto followed = problemOfPost(good + "x", true);
  ASSERT_TRUE(followed);
  EXPECT_EQ(followed->text, "bytes follow the end of the gzip body");
  std::string damaged = good;
  damaged[damaged.size() - 6] ^= 1;  // the checksum
  EXPECT_TRUE(problemOfPost(damaged, true));
}

TEST(PostsGzip, IsRefusedAsSoonAsItInflatesToTooMuch) {
  const std::string bomb = gzipped("{\"events\":[{\"a\":\"" + std::string(8 << 20, 'x') + "\"}]}");
  ASSERT_LT(bomb.size() * Limits::maxInflation, size_t{8} << 20);
  const auto problem = problemOfPost(bomb, true);
  ASSERT_TRUE(problem);
  EXPECT_TRUE(problem->isGzip);
  EXPECT_EQ(problem->text, "the gzip body inflates to too much");
  EXPECT_EQ(mostInflatedBytes(1), Limits::leastInflatedBytes);
  EXPECT_EQ(mostInflatedBytes(17 << 20), Limits::maxInflatedBytes);
}

}  // namespace
}  // namespace kyt::receiver
