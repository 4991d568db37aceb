#include "platform/objects/Base64.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

std::string encoded(std::string_view text) {
  return base64(std::as_bytes(std::span(text)));
}

std::optional<std::string> decoded(std::string_view text) {
  const auto data = base64Decode(text);
  if (!data) return std::nullopt;
  return std::string(data->view());
}

TEST(Base64, EncodesWithPadding) {
  EXPECT_EQ(encoded(""), "");
  EXPECT_EQ(encoded("f"), "Zg==");
  EXPECT_EQ(encoded("fo"), "Zm8=");
  EXPECT_EQ(encoded("foo"), "Zm9v");
  EXPECT_EQ(encoded("foobar"), "Zm9vYmFy");
  EXPECT_EQ(encoded("\xFF\xFE\xFD"), "//79");
}

TEST(Base64, DecodesWhatItEncoded) {
  std::string text;
  for (int i = 0; i < 300; ++i) {
    EXPECT_EQ(decoded(encoded(text)), text);
    text += static_cast<char>(i * 7);
  }
}

TEST(Base64, IgnoresCharactersOutsideItsAlphabet) {
  EXPECT_EQ(decoded(" Zm9v\nYm\tFy-\xFF"), "foobar");
  EXPECT_EQ(decoded("\n"), "");
}

TEST(Base64, RefusesWhatIsNotWhole) {
  for (const char* text : {"Z", "Zg", "Zg=", "Zm9", "Zm9v=", "Zg===", "Zg==Zg==", "=", "====", "Zm=9"})
    EXPECT_EQ(decoded(text), std::nullopt) << text;
}

}  // namespace
}  // namespace kyt
