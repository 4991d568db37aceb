#include "platform/base/TextEscape.h"

#include <gtest/gtest.h>

#include <functional>
#include <set>

namespace kyt {
namespace {

using namespace std::string_view_literals;

TEST(TextEscape, LeavesOrdinaryTextAlone) {
  for (std::string_view text :
       {""sv, "plain \\ \"text\" 100%"sv, "gr\u00fcn \u4e2d\u6587 \U0001F600"sv, "\u00a0\uFEFF"sv}) {
    EXPECT_EQ(escapedText(text), text);
    EXPECT_TRUE(isPlainText(text));
  }
}

TEST(TextEscape, WritesControlCharactersAsTheirBytes) {
  EXPECT_EQ(escapedText("a\0b\x1b[2J\x7f"sv), "a\\x00b\\x1b[2J\\x7f");
  EXPECT_EQ(escapedText("\xc2\x80\xc2\x9f\xc2\xa0"), "\\xc2\\x80\\xc2\\x9f\xc2\xa0");
  EXPECT_FALSE(isPlainText("\x1b"));
}

TEST(TextEscape, LeavesJSONWhatItIs) {
  EXPECT_EQ(escapedJSON("{\"a\":\"ä\\n€\"}"), "{\"a\":\"ä\\n€\"}");
  EXPECT_EQ(escapedJSON("\x7f\xC2\x85\xE2\x80\xA8\xE2\x80\xAE\xE2\x81\xA6\x01"),
            "\\u007f\\u0085\\u2028\\u202e\\u2066\\u0001");
  EXPECT_EQ(escapedJSON("\xFFz\xE2\x80"), "\\ufffdz\\ufffd\\ufffd");
}

TEST(TextEscape, NamesTabsAndLineBreaks) {
  EXPECT_EQ(escapedText("a\tb\nc\rd"), "a\\tb\\nc\\rd");
}

TEST(TextEscape, EscapesWhatBreaksOrReordersLines) {
  EXPECT_EQ(escapedText("\u2028\u2029"), "\\xe2\\x80\\xa8\\xe2\\x80\\xa9");
  EXPECT_EQ(escapedText("\u202e"), "\\xe2\\x80\\xae");
  EXPECT_EQ(escapedText("\u2066\u2069"), "\\xe2\\x81\\xa6\\xe2\\x81\\xa9");
  EXPECT_EQ(escapedText("\u2027\u202f\u2065\u206a"), "\u2027\u202f\u2065\u206a");
}

TEST(TextEscape, EscapesEveryByteThatIsNoUTF8) {
  EXPECT_EQ(escapedText("\x80z"), "\\x80z");                           // a stray continuation
  EXPECT_EQ(escapedText("\xc3(a"), "\\xc3(a");                         // a broken sequence
  EXPECT_EQ(escapedText("\xc0\xaf"), "\\xc0\\xaf");                    // overlong
  EXPECT_EQ(escapedText("\xe0\x9f\xbf"), "\\xe0\\x9f\\xbf");           // overlong
  EXPECT_EQ(escapedText("\xed\xa0\x80"), "\\xed\\xa0\\x80");           // a surrogate
  EXPECT_EQ(escapedText("\xf4\x90\x80\x80"), "\\xf4\\x90\\x80\\x80");  // past the last code point
  EXPECT_EQ(escapedText("\xf0\x9f\x98"), "\\xf0\\x9f\\x98");           // cut off
  EXPECT_EQ(escapedText("\xff\xfe"), "\\xff\\xfe");
}

TEST(TextEscape, TellsValidUTF8FromInvalid) {
  EXPECT_TRUE(isValidUTF8("a\u00fc\u4e2d\U0001F600\n"));
  EXPECT_TRUE(isValidUTF8("\xed\x9f\xbf\xee\x80\x80\xf4\x8f\xbf\xbf"));
  EXPECT_FALSE(isValidUTF8("a\xed\xa0\x80"));
  EXPECT_FALSE(isValidUTF8("\xf0\x8f\xbf\xbf"));
}

TEST(BeginningOf, TellsLongTextsApartAndLeavesShortOnes) {
  EXPECT_EQ(beginningOf("4f1c"), "4f1c");
  EXPECT_EQ(beginningOf("123456789012"), "123456789012");
  EXPECT_EQ(beginningOf("0123456789abcdef0123456789abcdef"), "01234567...");
  EXPECT_EQ(beginningOf("1234567\u00e9\u00e9\u00e9\u00e9"), "1234567...") << "no half of a character";
  EXPECT_EQ(beginningOf(std::string(20, '\x80')), "...");
}

TEST(TextEscape, WritesNoTwoNamesAlike) {
  EXPECT_EQ(escapedName("plain"), "plain");
  EXPECT_EQ(escapedName("a\n"), "a\\n");
  EXPECT_EQ(escapedName("a\\n"), "a\\x5cn");
  EXPECT_EQ(escapedName("\\"), "\\x5c");
  EXPECT_EQ(escapedName("\\\\x5c"), "\\x5c\\x5cx5c");
  std::set<std::string> written;
  const char kLetters[] = {'\\', '\n', 'n', 'x', '0', '1', '\x01', '\xC2', '\x85'};
  size_t names = 0;
  const std::function<void(std::string)> all = [&](const std::string& name) {
    written.insert(escapedName(name));
    ++names;
    if (name.size() < 4)
      for (const char letter : kLetters) all(name + letter);
  };
  all("");
  EXPECT_EQ(written.size(), names);
}

TEST(TextEscape, LeavesLineBreaksOfLines) {
  std::string out = "> ";
  appendEscapedLines(out, "a\n\x01\n\xC2\x85\xC3\xBC\r\n");
  EXPECT_EQ(out, "> a\n\\x01\n\\xc2\\x85\xC3\xBC\\r\n");
}

TEST(TextEscape, KnowsLinesThatStayAsTheyAre) {
  const std::string plain(200, 'x');
  EXPECT_TRUE(isPlainLines(""));
  EXPECT_TRUE(isPlainLines("{\n    \"~\": 1\n}\n"));
  EXPECT_TRUE(isPlainLines(plain));
  for (const char c : {'\0', '\t', '\r', '\x1F', '\x7F', '\x80', '\xC3', '\xFF'}) {
    EXPECT_FALSE(isPlainLines(std::string(1, c)));
    for (size_t at = 0; at < plain.size(); ++at) {
      std::string text = plain;
      text[at] = c;
      EXPECT_FALSE(isPlainLines(text)) << at;
    }
  }
}

}  // namespace
}  // namespace kyt
