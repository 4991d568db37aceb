#include "config/Environment.h"

#include <gtest/gtest.h>

#include "platform/UserDefaults.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class EnvironmentTest : public ::testing::Test {
 protected:
  void setDefault(const char* key, Value value) {
    test_.userDefaults.put(kKYTReportingDefaultsDomain, key, std::move(value));
  }
  void makeInternal() { test_.deviceProperties.setProperty("ReleaseType", "Internal"); }
  TestPlatform test_;
};

TEST_F(EnvironmentTest, IsReleaseWithoutASetting) {
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentRelease);
  EXPECT_TRUE(test_.sink.contains(LogLevel::normal, "userDefaultsEnvironment: Environment type 4"));
}

TEST_F(EnvironmentTest, IsInternalOnAnInternalBuildWithoutASetting) {
  makeInternal();
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentInternal);
}

TEST_F(EnvironmentTest, TakesTheSettingAsItIs) {
  makeInternal();
  for (uint32_t type : {0U, 1U, 2U, 3U, 4U}) {
    setDefault("environmentType", type);
    EXPECT_EQ(test_.environment.userDefaultsEnvironment(), type);
    EXPECT_EQ(test_.environment.cachedEnvironment(), type);
  }
}

TEST_F(EnvironmentTest, ReadsASettingThatIsText) {
  setDefault("environmentType", "3");
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentSeed);
}

TEST_F(EnvironmentTest, UsesInternalForAnInvalidSetting) {
  setDefault("environmentType", 7);
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentInternal);
  EXPECT_TRUE(test_.sink.contains(LogLevel::error, "userDefaultsEnvironment: Invalid environment type 7"));
  EXPECT_TRUE(test_.sink.contains(LogLevel::normal, "userDefaultsEnvironment: Environment type 2"));
  setDefault("environmentType", -1);
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentInternal);
}

TEST_F(EnvironmentTest, IsWorkedOutAtEveryCall) {
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentRelease);
  setDefault("environmentType", 1);
  EXPECT_EQ(test_.environment.userDefaultsEnvironment(), kEnvironmentDevelopment);
}

TEST_F(EnvironmentTest, NamesTheSections) {
  EXPECT_EQ(environmentName(1), String("development"));
  EXPECT_EQ(environmentName(2), String("vantu_internal"));
  EXPECT_EQ(environmentName(3), String("seed"));
  EXPECT_EQ(environmentName(4), String("release"));
  EXPECT_FALSE(environmentName(0));
  EXPECT_FALSE(environmentName(5));
}

TEST_F(EnvironmentTest, TakesStorebagsFromThePublicHost) {
  EXPECT_EQ(test_.environment.storebagServerURL(), "https://bags.example.org/bags/tolvar");
}

TEST_F(EnvironmentTest, TakesStorebagsFromThePartnersHostOnAnInternalBuild) {
  makeInternal();
  EXPECT_EQ(test_.environment.storebagServerURL(), "https://partners.example.org/storebags/tolvar");
}

TEST_F(EnvironmentTest, ASettingOverridesBothHosts) {
  setDefault("kytreporting_storebag_url", "http://127.0.0.1:8080/x");
  EXPECT_EQ(test_.environment.storebagServerURL(), "http://127.0.0.1:8080/x");
  TestPlatform internal;
  internal.deviceProperties.setProperty("ReleaseType", "Internal");
  internal.userDefaults.put(kKYTReportingDefaultsDomain, "kytreporting_storebag_url", "http://h");
  EXPECT_EQ(internal.environment.storebagServerURL(), "http://h");
}

TEST_F(EnvironmentTest, AnswersOnlyTextForAStringSetting) {
  EXPECT_FALSE(test_.environment.stringUserDefault("httpsPostURL"));
  setDefault("httpsPostURL", 5);
  EXPECT_FALSE(test_.environment.stringUserDefault("httpsPostURL"));
  setDefault("httpsPostURL", "https://h/p");
  EXPECT_EQ(test_.environment.stringUserDefault("httpsPostURL"), String("https://h/p"));
}

}  // namespace
}  // namespace kyt
