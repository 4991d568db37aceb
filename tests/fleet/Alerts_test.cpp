// The alerts that the packages bring, in the eyes of Prometheus' own checker.
#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

class Alerts : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!isInstalled("promtool")) GTEST_SKIP() << "promtool is not installed";
    std::filesystem::copy(KYT_FLEET_FILES "/alerts.yml", folder_ / "alerts.yml");
    std::filesystem::copy(KYT_FLEET_TESTS "/alerts-test.yml", folder_ / "alerts-test.yml");
  }
  TemporaryFolder folder_;
};

TEST_F(Alerts, AreRulesThatPrometheusTakes) {
  const ProgramRun run = runProgram("promtool", {"check", "rules", folder_ / "alerts.yml"});
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_NE(run.text.find("SUCCESS"), std::string::npos) << run.text;
}

TEST_F(Alerts, SpeakUpInAnOutageAndAreSilentOtherwise) {
  const ProgramRun run = runProgram("promtool", {"test", "rules", folder_ / "alerts-test.yml"});
  EXPECT_EQ(run.status, 0) << run.text;
}

}  // namespace
}  // namespace kyt
