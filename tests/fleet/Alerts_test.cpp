// The alerts that the packages bring, in the eyes of Prometheus' own checker.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
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

TEST_F(Alerts, AskForFiguresThatReceiversGive) {
  const auto textOf = [](const std::string& path) {
    std::ifstream file(path);
    return std::string(std::istreambuf_iterator<char>(file), {});
  };
  const std::string rules = textOf(KYT_FLEET_FILES "/alerts.yml"),
                    metrics = textOf(KYT_SOURCE_DIR "/receiver/Metrics.cpp"),
                    reasons = textOf(KYT_SOURCE_DIR "/receiver/Figures.cpp");
  int names = 0;
  const std::regex figure("kyt_[a-z_]+");
  for (std::sregex_iterator i(rules.begin(), rules.end(), figure), end; i != end; ++i, ++names) {
    std::string name = i->str();
    if (name.ends_with("_total")) name.resize(name.size() - 6);
    EXPECT_NE(metrics.find("(\"" + name + "\""), std::string::npos) << name;
  }
  EXPECT_GE(names, 9);
  for (const char* reason : {"spool-full", "spool-broken", "bodies-full"}) {
    EXPECT_NE(rules.find(reason), std::string::npos);
    EXPECT_NE(reasons.find(std::string("\"") + reason + "\""), std::string::npos) << reason;
  }
}

}  // namespace
}  // namespace kyt
