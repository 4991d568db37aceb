// Text helpers of the back ends.
#include "backend/Text.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

using Pieces = std::vector<std::string_view>;

TEST(Text, SplitsAtEverySeparatorAndKeepsEmptyPieces) {
  EXPECT_EQ(splitText("a,,b,", ","), (Pieces{"a", "", "b", ""}));
  EXPECT_EQ(splitText("", ","), Pieces{""});
  EXPECT_EQ(splitText("http://a://b", "://"), (Pieces{"http", "a", "b"}));
}

TEST(Text, FoldsLettersOfTheCommonAlphabetsAndKeepsLengths) {
  EXPECT_EQ(foldCase("EMail-9"), "email-9");
  EXPECT_EQ(foldCase("ÄÖÜ×Þ"), "äöü×þ");
  EXPECT_EQ(foldCase("ĀŁŻŸŽ"), "āłżÿž");
  EXPECT_EQ(foldCase("ΆΈΌΎΑΣς"), "άέόύασσ");
  EXPECT_EQ(foldCase("ЁЖ"), "ёж");
  EXPECT_EQ(foldCase("İ東京"), "İ東京");  // no lower case of the same length, and no case at all
}

TEST(Text, LeavesMalformedTextAsItIs) {
  EXPECT_EQ(foldCase("\xC3"), "\xC3");
  EXPECT_EQ(foldCase("\xC3Z"), "\xC3z");
  EXPECT_EQ(foldCase("\xFF\x80"), "\xFF\x80");
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

TEST(Text, WritesLowerCaseHexadecimalDigits) {
  std::string text;
  appendHex(std::as_bytes(std::span(std::string_view("\x0A\xFF"))), text);
  EXPECT_EQ(text, "0aff");
}

}  // namespace
}  // namespace kyt
