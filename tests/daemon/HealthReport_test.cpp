#include "daemon/HealthReport.h"

#include <gtest/gtest.h>

#include <vector>

namespace kyt {
namespace {

TEST(HealthReport, WritesTheCodesInTheOrderInWhichTheyCameUp) {
  HealthReport report;
  report.addSession(7, 10);
  report.addSession(2, 20);
  report.addSession(7, 30);
  report.addSession(24, 40);
  Dictionary payload{{"first", 1}};
  report.write(payload);
  std::vector<std::string> keys;
  for (const DictionaryEntry& entry : payload) keys.push_back(entry.key.str());
  EXPECT_EQ(keys, (std::vector<std::string>{"first", "SessionsCount_QH", "BatchSize_QH",
                                            "SessionsCount_Unknown", "BatchSize_Unknown"}));
  EXPECT_EQ(*payload.find("SessionsCount_QH"), Value(2));
  EXPECT_EQ(*payload.find("BatchSize_QH"), Value(40));
  EXPECT_EQ(*payload.find("SessionsCount_Unknown"), Value(2));
  EXPECT_EQ(*payload.find("BatchSize_Unknown"), Value(60));
}

TEST(HealthReport, TellsTypesFromFiveToTwentyThreeApart) {
  for (int32_t type : {5, 23}) {
    HealthReport report;
    report.addSession(type, 0);
    Dictionary payload;
    report.write(payload);
    EXPECT_FALSE(payload.contains("SessionsCount_Unknown")) << type;
  }
  for (int32_t type : {-1, 0, 4, 24}) {
    HealthReport report;
    report.addSession(type, 0);
    Dictionary payload;
    report.write(payload);
    EXPECT_TRUE(payload.contains("SessionsCount_Unknown")) << type;
  }
}

TEST(HealthReport, WritesNothingWithoutSessions) {
  Dictionary payload;
  HealthReport().write(payload);
  EXPECT_TRUE(payload.empty());
}

}  // namespace
}  // namespace kyt
