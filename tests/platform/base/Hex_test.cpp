#include "platform/base/Hex.h"

#include <gtest/gtest.h>

#include <string>
#include <string_view>

namespace kyt {
namespace {

TEST(Hex, WritesEachByteAsTwoDigitsInLowerCase) {
  std::string text = "so: ";
  appendHex(std::string_view("\x00\x0a\x9f\xff", 4), text);
  EXPECT_EQ(text, "so: 000a9fff");
}

TEST(Hex, ReadsEveryByteBack) {
  for (int byte = 0; byte < 256; ++byte) {
    std::string text;
    appendHexByte(static_cast<uint8_t>(byte), text);
    EXPECT_EQ(hexDigit(text[0]) * 16 + hexDigit(text[1]), byte);
  }
}

TEST(Hex, KnowsDigitsOfBothCasesAndNothingElse) {
  const std::string_view digits = "0123456789abcdefABCDEF";
  for (int c = 0; c < 256; ++c) {
    const bool isDigit = digits.find(static_cast<char>(c)) != std::string_view::npos;
    EXPECT_EQ(hexDigit(static_cast<char>(c)) >= 0, isDigit) << c;
  }
  EXPECT_EQ(hexDigit('F'), 15);
  EXPECT_EQ(hexDigit('c'), 12);
}

}  // namespace
}  // namespace kyt
