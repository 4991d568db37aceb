#include "config/ClientTypes.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <map>
#include <string>

namespace kyt {
namespace {

TEST(ClientTypes, TypesShareStorebags) {
  std::map<std::string, int> uses;
  for (int32_t type = 0; type < kNumberOfClientTypes; ++type)
    if (const auto name = storebagNameForClientType(type)) ++uses[name->str()];
  EXPECT_EQ(uses["cadmor"], 4);
  EXPECT_EQ(uses["brisca"], 3);
  EXPECT_EQ(uses.size(), 14U);
}

TEST(ClientTypes, NamesTheStorebagAndTheCode) {
  EXPECT_EQ(storebagNameForClientType(11), String("cadmor"));
  EXPECT_STREQ(clientTypeShortCode(11), "QM");
  EXPECT_EQ(storebagNameForClientType(5), String("torvel"));
  EXPECT_STREQ(clientTypeShortCode(0), "QA");
  EXPECT_STREQ(clientTypeShortCode(15), "QG-VELMO");
  EXPECT_EQ(storebagNameForClientType(23), String("nessim"));
  EXPECT_STREQ(clientTypeShortCode(23), "QV");
}

TEST(ClientTypes, HasNoStorebagBelowFiveAndPastTheTable) {
  for (int32_t type : {0, 1, 2, 3, 4, 24, -1, std::numeric_limits<int32_t>::min()})
    EXPECT_FALSE(storebagNameForClientType(type)) << type;
}

TEST(ClientTypes, AnswersUnknownForNumbersThatAreNoType) {
  for (int32_t type : {24, -1, std::numeric_limits<int32_t>::max(), std::numeric_limits<int32_t>::min()})
    EXPECT_STREQ(clientTypeShortCode(type), "Unknown") << type;
}

}  // namespace
}  // namespace kyt
