// Text helpers of the back ends.
#include "backend/Text.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <map>

#include "backend/CaseFoldingTable.h"

namespace kyt {
namespace {

using Pieces = std::vector<std::string_view>;

std::string utf8(uint32_t c) {
  const auto byte = [](uint32_t value) { return static_cast<char>(value); };
  if (c < 0x80) return {byte(c)};
  if (c < 0x800) return {byte(0xC0 | c >> 6), byte(0x80 | (c & 63))};
  if (c < 0x10000) return {byte(0xE0 | c >> 12), byte(0x80 | (c >> 6 & 63)), byte(0x80 | (c & 63))};
  return {byte(0xF0 | c >> 18), byte(0x80 | (c >> 12 & 63)), byte(0x80 | (c >> 6 & 63)),
          byte(0x80 | (c & 63))};
}

TEST(Text, SplitsAtEverySeparatorAndKeepsEmptyPieces) {
  EXPECT_EQ(splitText("a,,b,", ","), (Pieces{"a", "", "b", ""}));
  EXPECT_EQ(splitText("", ","), Pieces{""});
  EXPECT_EQ(splitText("http://a://b", "://"), (Pieces{"http", "a", "b"}));
}

TEST(Text, FoldsLettersOfEveryAlphabet) {
  EXPECT_EQ(foldCase("EMail-9"), "email-9");
  EXPECT_EQ(foldCase("ÄÖÜ×Þ"), "äöü×þ");
  EXPECT_EQ(foldCase("ĀŁŻŸŽ"), "āłżÿž");
  EXPECT_EQ(foldCase("ΆΈΌΎΑΣς"), "άέόύασσ");
  EXPECT_EQ(foldCase("ЁЖ"), "ёж");
  EXPECT_EQ(foldCase("İ東京"), "İ東京");  // none that is one character in every language, and no case at all
  EXPECT_EQ(foldCase("ĐỊA CHỈ"), "địa chỉ");
  EXPECT_EQ(foldCase("ԱՐԵՎ ⅣⒶ Ａ 𐐀𞤀"), "արեվ ⅳⓐ ａ 𐐨𞤢");
  EXPECT_EQ(foldCase("\u212A\u2126\u1E9E\u017F\u023A"), "k\u03C9\u00DFs\u2C65") << "other numbers of bytes";
}

// Whoever changes the table sees here what it should say.
TEST(Text, FoldsEachCharacterAsUnicodeSays) {
  std::ifstream file("/usr/share/unicode/CaseFolding.txt");
  if (!file) GTEST_SKIP() << "needs unicode-data";
  std::string line;
  ASSERT_TRUE(std::getline(file, line));
  if (line != std::string("# CaseFolding-") + kCaseFoldingVersion + ".txt") GTEST_SKIP() << "another version";
  std::map<uint32_t, uint32_t> simple;
  while (std::getline(file, line)) {
    unsigned from = 0, to = 0;
    char kind = 0;
    if (std::sscanf(line.c_str(), "%X; %c; %X", &from, &kind, &to) == 3 && (kind == 'C' || kind == 'S'))
      simple[from] = to;
  }
  EXPECT_GT(simple.size(), 1400U);
  for (uint32_t character = 0; character <= 0x10FFFF; ++character) {
    const auto found = simple.find(character);
    ASSERT_EQ(foldCharacter(character), found != simple.end() ? found->second : character) << character;
  }
}

TEST(Text, KnowsTheSizesOfEveryTextThatFoldsToOne) {
  for (const CaseFoldingRange& range : kCaseFolding)
    for (uint32_t from = range.first; from <= range.last; from += range.step) {
      const std::string text = utf8(from), folded = foldCase(text);
      EXPECT_EQ(folded, utf8(foldCharacter(from)));
      EXPECT_TRUE(equalsFolded(text, folded)) << from;
      for (const std::string& whole : {text, "a" + text + "a", text + "a", "a" + text}) {
        const UnfoldedSizes sizes = unfoldedSizes(foldCase(whole));
        EXPECT_LE(sizes.least, whole.size()) << from;
        EXPECT_GE(sizes.most, whole.size()) << from;
        const bool ascii = ((whole.front() | whole.back()) & 0x80) == 0;
        EXPECT_TRUE(ascii ? sizes.endsMayBeASCII : sizes.endsMayBeNonASCII) << from;
      }
    }
  const UnfoldedSizes plain = unfoldedSizes("email");
  EXPECT_EQ(plain.least, 5U);
  EXPECT_EQ(plain.most, 5U);
  EXPECT_FALSE(plain.endsMayBeNonASCII);
}

TEST(Text, LeavesMalformedTextAsItIs) {
  EXPECT_EQ(foldCase("\xC3"), "\xC3");
  EXPECT_EQ(foldCase("\xC3Z"), "\xC3z");
  EXPECT_EQ(foldCase("\xFF\x80"), "\xFF\x80");
  for (const char* text :
       {"\xC1\x81", "\xE0\x81\x81", "\xED\xA0\x80", "\xF4\x90\x80\x80", "\xE1\xBA", "\xF5\x80\x80\x80"}) {
    EXPECT_EQ(foldCase(text), text);
    EXPECT_TRUE(equalsFolded(text, text));
  }
}

TEST(Text, ComparesWithoutCase) {
  EXPECT_TRUE(equalsIgnoringCase("HTTPS", "https"));
  EXPECT_TRUE(equalsFolded("Größe", "größe"));
  EXPECT_TRUE(equalsFolded("GRÖSSE", "grösse"));
  EXPECT_FALSE(equalsFolded("email", "emails"));
  EXPECT_FALSE(equalsFolded("emaiL", "emaix"));
}

TEST(Text, ReadsThreePartsOfAVersionModulo256) {
  using Parts = std::array<uint8_t, 3>;
  EXPECT_EQ(versionParts("10.2.3.4"), (Parts{10, 2, 3}));
  EXPECT_EQ(versionParts("300"), (Parts{44, 0, 0}));
  EXPECT_EQ(versionParts("abc.2"), (Parts{0, 2, 0}));
  EXPECT_EQ(versionParts(""), (Parts{0, 0, 0}));
}

}  // namespace
}  // namespace kyt
