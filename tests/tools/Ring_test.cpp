#include "tools/Ring.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdio>
#include <string>

#include "platform/linux/data/OpenSSLCryptography.h"

namespace kyt::tools {
namespace {

// As devices have them: 40 hexadecimal characters.
std::string identifier(int number, Cryptography& cryptography) {
  const std::string text = "device-" + std::to_string(number);
  std::string hex;
  for (const std::byte byte : cryptography.sha1(std::as_bytes(std::span(text)))) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", std::to_integer<unsigned>(byte));
    hex += digits;
  }
  return hex;
}

TEST(Ring, IsTheSameForADeviceForGood) {
  OpenSSLCryptography cryptography;
  EXPECT_EQ(ringOf("0000000000000000000000000000000000000000", cryptography), 26U);
  EXPECT_EQ(ringOf("da39a3ee5e6b4b0d3255bfef95601890afd80709", cryptography), 27U);
  EXPECT_EQ(ringText(7), "07");
}

TEST(Ring, HoldsBetweenSixtyAndAHundredAndFortyOfTenThousandDevices) {
  OpenSSLCryptography cryptography;
  std::array<int, kRings> devices{};
  for (int i = 0; i < 10000; ++i) ++devices.at(ringOf(identifier(i, cryptography), cryptography));
  for (const int count : devices) {
    EXPECT_GE(count, 60);
    EXPECT_LE(count, 140);
  }
  // What the guide's steps reach: so many rings from the first on, so many devices.
  const auto reached = [&devices](size_t rings) {
    int sum = 0;
    for (size_t i = 0; i < rings; ++i) sum += devices.at(i);
    return sum;
  };
  EXPECT_NEAR(reached(1), 100, 40);
  EXPECT_NEAR(reached(5), 500, 90);
  EXPECT_NEAR(reached(25), 2500, 180);
  EXPECT_EQ(reached(100), 10000);
}

TEST(Ring, HasItsPlaceInAnAddress) {
  EXPECT_EQ(addressOfRing("https://h/r{ring}/x{ring}", 3), "https://h/r03/x03");
  EXPECT_EQ(addressOfRing("https://h/x", 3), std::nullopt);
}

}  // namespace
}  // namespace kyt::tools
