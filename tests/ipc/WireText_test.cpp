#include "platform/ipc/WireText.h"

#include <gtest/gtest.h>

#include <string>

namespace kyt::wire {
namespace {

using namespace std::string_literals;

TEST(WireText, TextIsUTF8WithoutNULWhereverTheFaultStands) {
  for (size_t length = 0; length < 40; ++length) {
    const std::string plain(length, 'x');
    EXPECT_TRUE(isValidText(plain));
    for (size_t at = 0; at < length; ++at) {
      for (const char bad : {'\0', '\x80', '\xFF', '\xC3', '\xED'}) {
        std::string text = plain;
        text[at] = bad;
        EXPECT_FALSE(isValidText(text)) << length << " " << at;
      }
      if (at + 2 <= length) {
        std::string text = plain;
        text.replace(at, 2, "\xC3\xA4");
        EXPECT_TRUE(isValidText(text)) << length << " " << at;
      }
    }
  }
}

TEST(WireText, KnowsTheEdgesOfUTF8) {
  for (const auto& good : {"\x7F"s, "\xC2\x80"s, "\xDF\xBF"s, "\xE0\xA0\x80"s, "\xED\x9F\xBF"s,
                           "\xEE\x80\x80"s, "\xEF\xBF\xBF"s, "\xF0\x90\x80\x80"s, "\xF4\x8F\xBF\xBF"s}) {
    EXPECT_TRUE(isValidText(good));
  }
  for (const auto& bad : {"\xC1\xBF"s, "\xE0\x9F\xBF"s, "\xED\xA0\x80"s, "\xF0\x8F\xBF\xBF"s,
                          "\xF4\x90\x80\x80"s, "\xF5\x80\x80\x80"s, "\xE2\x82"s, "\xF0\x9F\x98"s}) {
    EXPECT_FALSE(isValidText(bad));
    std::string repaired;
    appendValidText(bad, repaired);
    EXPECT_TRUE(isValidText(repaired));
    EXPECT_NE(repaired.find("\xEF\xBF\xBD"), std::string::npos);
  }
}

TEST(WireText, KnowsObjectPaths) {
  for (const char* good : {"/", "/a", "/com/vantu/kytreportingd", "/_0/Z9"})
    EXPECT_TRUE(isValidObjectPath(good));
  for (const char* bad : {"", "a", "//", "/a/", "/a//b", "/a-b", "/\xC3\xA4"})
    EXPECT_FALSE(isValidObjectPath(bad));
}

TEST(WireText, KnowsNames) {
  for (const char* good : {"a.b", "org.freedesktop.DBus", "_a._1"}) EXPECT_TRUE(isValidInterfaceName(good));
  for (const char* bad : {"", "a", ".a", "a.", "a..b", "a.1b", "a-b.c", ":1.2"})
    EXPECT_FALSE(isValidInterfaceName(bad));
  EXPECT_FALSE(isValidInterfaceName("a." + std::string(254, 'b')));
  EXPECT_TRUE(isValidInterfaceName("a." + std::string(253, 'b')));
  for (const char* good : {"Ping", "_x", "a1"}) EXPECT_TRUE(isValidMemberName(good));
  for (const char* bad : {"", "1a", "a.b", "a-b"}) EXPECT_FALSE(isValidMemberName(bad));
  for (const char* good : {":1.42", "a-b.c", "com.example"}) EXPECT_TRUE(isValidBusName(good));
  for (const char* bad : {"", ":", ":1", "1.a", "a"}) EXPECT_FALSE(isValidBusName(bad));
}

TEST(WireText, KnowsSignatures) {
  for (const char* good : {"", "y", "a{sv}aa{sv}avb", "(ii(d))", "a{s(iav)}", "aaaa{i(s)}"}) {
    EXPECT_TRUE(isValidSignature(good)) << good;
  }
  for (const char* bad :
       {"a", "z", "(", ")", "()", "{sv}", "a{s}", "a{svs}", "a{vs}", "a{sv", "(i", "r", "e"}) {
    EXPECT_FALSE(isValidSignature(bad)) << bad;
  }
  EXPECT_TRUE(isValidSingleSignature("a{sv}"));
  EXPECT_FALSE(isValidSingleSignature("yy"));
  EXPECT_FALSE(isValidSingleSignature(""));
  EXPECT_TRUE(isValidSignature(std::string(255, 'y')));
  EXPECT_FALSE(isValidSignature(std::string(256, 'y')));
}

TEST(WireText, SignaturesNestThirtyTwoArraysAndThirtyTwoStructs) {
  const auto structs = [](size_t n) { return std::string(n, '(') + "y" + std::string(n, ')'); };
  EXPECT_TRUE(isValidSignature(std::string(32, 'a') + structs(32)));
  EXPECT_FALSE(isValidSignature(std::string(33, 'a') + "y"));
  EXPECT_FALSE(isValidSignature(structs(33)));
}

}  // namespace
}  // namespace kyt::wire
