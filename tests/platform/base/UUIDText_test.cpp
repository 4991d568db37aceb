#include "platform/base/UUIDText.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

TEST(UUIDText, IsUpperCaseWithItsGroups) {
  std::array<std::byte, 16> bytes{};
  for (size_t i = 0; i < 16; ++i) bytes[i] = static_cast<std::byte>(0xF0 - i);
  EXPECT_EQ(uuidText(bytes), "F0EFEEED-ECEB-EAE9-E8E7-E6E5E4E3E2E1");
}

}  // namespace
}  // namespace kyt
