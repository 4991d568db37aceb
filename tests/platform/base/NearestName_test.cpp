#include "platform/base/NearestName.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace kyt {
namespace {

const std::vector<std::string> kKnown = {"limits.max_message_bytes", "limits.max_connections", "log.level",
                                         "log.target", "user"};

TEST(NearestName, IsTheOneThatTheFewestLettersTellApart) {
  EXPECT_EQ(nearestName("limits.max_mesage_byte", kKnown), "limits.max_message_bytes");
  EXPECT_EQ(nearestName("limits.max_conections", kKnown), "limits.max_connections");
  EXPECT_EQ(nearestName("log.levle", kKnown), "log.level");
  EXPECT_EQ(nearestName("usr", kKnown), "user");
}

TEST(NearestName, DoesNotCountCase) {
  EXPECT_EQ(nearestName("LOG.Level", kKnown), "log.level");
}

TEST(NearestName, IsNoneWhereNoNameIsNear) {
  EXPECT_EQ(nearestName("com.example.entitlement", kKnown), std::nullopt);
  EXPECT_EQ(nearestName("abc", kKnown), std::nullopt);
  EXPECT_EQ(nearestName("log.level", {}), std::nullopt);
  EXPECT_EQ(nearestName(std::string(100000, 'l'), kKnown), std::nullopt) << "and costs nothing";
}

}  // namespace
}  // namespace kyt
