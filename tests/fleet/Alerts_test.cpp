// The alerts that the packages bring, in the eyes of Prometheus' own checker.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <string>
#include <utility>
#include <vector>

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

std::string textOf(const std::string& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

// Each match of the pattern's first group.
std::vector<std::string> matchesOf(const std::string& text, const char* pattern) {
  std::vector<std::string> found;
  const std::regex expression(pattern);
  for (std::sregex_iterator i(text.begin(), text.end(), expression), end; i != end; ++i)
    found.push_back((*i)[1]);
  return found;
}

TEST_F(Alerts, AskForFiguresThatReceiversGive) {
  const std::string metrics = textOf(KYT_SOURCE_DIR "/receiver/Metrics.cpp");
  const auto names = matchesOf(textOf(KYT_FLEET_FILES "/alerts.yml"), "(kyt_[a-z_]+)");
  EXPECT_GE(names.size(), 9U);
  for (std::string name : names) {
    if (name.ends_with("_total")) name.resize(name.size() - 6);
    EXPECT_NE(metrics.find("(\"" + name + "\""), std::string::npos) << name;
  }
}

TEST_F(Alerts, KnowEachReasonOfARefusalOnce) {
  const std::string figures = textOf(KYT_SOURCE_DIR "/receiver/Figures.cpp");
  const size_t names = figures.find("kNames = {");
  ASSERT_NE(names, std::string::npos);
  auto reasons = matchesOf(figures.substr(names, figures.find("};", names) - names), "\"([a-z-]+)\"");
  EXPECT_GE(reasons.size(), 19U);
  std::vector<std::string> known;
  for (const std::string& list :
       matchesOf(textOf(KYT_FLEET_FILES "/alerts.yml"), "kyt_refused_total\\{reason=~\"([a-z|-]+)\""))
    for (std::string& reason : matchesOf(list, "([a-z-]+)")) known.push_back(std::move(reason));
  std::sort(reasons.begin(), reasons.end());
  std::sort(known.begin(), known.end());
  EXPECT_EQ(known, reasons);
}

}  // namespace
}  // namespace kyt
