// The factory, with classes of its own; which concrete class stands under which name is BackendTable's test.
#include "backend/BackendFactory.h"

#include <gtest/gtest.h>

#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

constexpr char kNilTable[] = "createBackends: Attempted to create backends with nil storebag";
constexpr char kNilInfo[] = "createBackends: Attempted to create backends with nil session info";

class BackendFactoryTest : public testing::Test {
 protected:
  struct Made {
    std::string creator;
    std::optional<String> productFamily;
    int32_t clientType;
  };

  BackendCreator creator(const char* name, const char* label) {
    return {name, [this, label](const String& n, const Dictionary& profile, const SharedSessionFacts& facts) {
              made_.push_back({label, facts->productFamily, facts->compType});
              platform_.clock.setTimeOfDay({200, 0});  // making one takes its time
              return KYTReportingBackend::initWithName(platform_.platform, n, profile, facts);
            }};
  }
  DefaultBackendFactory factory() {
    return {platform_.configuration,
            {creator(kKYTReportingBackendDashboard, "first"),
             creator(kKYTReportingBackendDashboard, "second"),
             creator(kKYTReportingBackendQDX, "qdx"),
             {"failing", [](const auto&...) { return std::shared_ptr<KYTReportingBackend>(); }}}};
  }
  std::optional<Backends> create(const std::optional<Dictionary>& table,
                                 const std::optional<Dictionary>& info,
                                 const std::optional<Dictionary>& userInfo = std::nullopt) {
    return factory().createBackends(table, info, userInfo, "device");
  }
  size_t errorLines() const {
    size_t lines = 0;
    for (const auto& line : platform_.sink.lines()) lines += line.level == LogLevel::error;
    return lines;
  }

  TestPlatform platform_;
  std::vector<Made> made_;
};

TEST_F(BackendFactoryTest, AMissingTableYieldsNothingAndOneLine) {
  EXPECT_FALSE(create(std::nullopt, std::nullopt));
  EXPECT_TRUE(platform_.sink.contains(LogLevel::error, kNilTable));
  EXPECT_EQ(errorLines(), 1u);
}

TEST_F(BackendFactoryTest, MissingSessionInformationYieldsNothingAndOneLine) {
  EXPECT_FALSE(create(Dictionary{{kKYTReportingBackendDashboard, Dictionary{}}}, std::nullopt));
  EXPECT_TRUE(platform_.sink.contains(LogLevel::error, kNilInfo));
  EXPECT_TRUE(made_.empty());
}

TEST_F(BackendFactoryTest, AnEmptyTableYieldsAnEmptySet) {
  const std::optional<Backends> backends = create(Dictionary{}, Dictionary{});
  ASSERT_TRUE(backends);
  EXPECT_TRUE(backends->empty());
  EXPECT_EQ(errorLines(), 0u);
}

TEST_F(BackendFactoryTest, TheFirstRowOfANameDecides) {
  const std::optional<Backends> backends =
      create(Dictionary{{kKYTReportingBackendDashboard, Dictionary{{"k", 1}}}}, Dictionary{});
  ASSERT_TRUE(backends);
  ASSERT_EQ(made_.size(), 1u);
  EXPECT_EQ(made_[0].creator, "first");
  EXPECT_EQ(backends->find(kKYTReportingBackendDashboard)->profile(), (Dictionary{{"k", 1}}));
}

TEST_F(BackendFactoryTest, AProfileThatIsNoDictionaryIsAnEmptyOne) {
  const std::optional<Backends> backends =
      create(Dictionary{{kKYTReportingBackendDashboard, "profile"}}, Dictionary{});
  ASSERT_EQ(backends->size(), 1u);
  EXPECT_TRUE(backends->find(kKYTReportingBackendDashboard)->profile().empty());
}

TEST_F(BackendFactoryTest, AnUnknownNameIsLoggedAndTheOthersAreMade) {
  const std::optional<Backends> backends = create(
      Dictionary{{"telegraph", Dictionary{}}, {kKYTReportingBackendDashboard, Dictionary{}}}, Dictionary{});
  ASSERT_TRUE(backends);
  EXPECT_EQ(backends->size(), 1u);
  EXPECT_EQ(platform_.sink.count(LogLevel::error, "KYTReportingBackend(newBackendWithName): telegraph"), 1u);
}

TEST_F(BackendFactoryTest, ANameWhoseClassIsNotThereIsUnknown) {
  DefaultBackendFactory none(platform_.configuration, {});
  EXPECT_EQ(none.newBackendWithName(kKYTReportingBackendHTTPPost, {}, std::make_shared<SessionFacts>()),
            nullptr);
  EXPECT_TRUE(platform_.sink.contains(LogLevel::error, "KYTReportingBackend(newBackendWithName): httppost"));
}

TEST_F(BackendFactoryTest, AnInitialiserThatFailsIsSkippedWithoutALine) {
  const std::optional<Backends> backends = create(Dictionary{{"failing", Dictionary{}}}, Dictionary{});
  ASSERT_TRUE(backends);
  EXPECT_TRUE(backends->empty());
  EXPECT_EQ(errorLines(), 0u);
}

TEST_F(BackendFactoryTest, ADesktopDeviceHasNoQDX) {
  platform_.deviceProperties.setProperty("ProductType", "Desktop");
  EXPECT_TRUE(create(Dictionary{{kKYTReportingBackendQDX, Dictionary{}}}, Dictionary{})->empty());
  EXPECT_EQ(platform_.sink.count(LogLevel::error, "KYTReportingBackend(newBackendWithName): qdx"), 1u);
  EXPECT_TRUE(made_.empty());
}

TEST_F(BackendFactoryTest, AnyOtherDeviceHasQDX) {
  const Dictionary info{{kKYTReportingSessionInfoClientType, 7}};
  EXPECT_EQ(create(Dictionary{{kKYTReportingBackendQDX, Dictionary{}}}, info)->size(), 1u);
  ASSERT_EQ(made_.size(), 1u);
  EXPECT_EQ(made_[0].clientType, 7);
}

TEST_F(BackendFactoryTest, ADeviceOfUnknownTypeHasQDX) {
  platform_.deviceProperties.removeProperty("ProductType");
  EXPECT_EQ(create(Dictionary{{kKYTReportingBackendQDX, Dictionary{}}}, Dictionary{})->size(), 1u);
}

TEST_F(BackendFactoryTest, StampsSessionDeviceAndVersionOnEveryBackEnd) {
  platform_.deviceProperties.setProperty("ProductVersion", "17.1");
  platform_.deviceProperties.setProperty("BuildVersion", "21B74");
  platform_.deviceProperties.setProperty("ProductType", "Phone9,1");
  platform_.deviceProperties.setProperty("DeviceName", "Phone");
  platform_.deviceProperties.setProperty("ReleaseType", "Internal");
  platform_.daemonBundle.setVersion("9.1.2");
  platform_.clock.setTimeOfDay({100, 500000});
  const Dictionary info{{kKYTReportingSessionInfoSessionID, 4294967295u},
                        {kKYTReportingSessionInfoClientType, 11},
                        {kKYTReportingSessionInfoClientVersion, 65537},
                        {kKYTReportingSessionInfoRequireUserInfo, true},
                        {kKYTReportingSessionInfoBatchEvent, "yes"}};
  const Dictionary userInfo{{kKYTReportingUserInfoClientName, "a"}};
  const std::optional<Backends> backends = create(
      Dictionary{{kKYTReportingBackendDashboard, Dictionary{}}, {kKYTReportingBackendQDX, Dictionary{}}},
      info, userInfo);
  ASSERT_TRUE(backends);
  ASSERT_EQ(backends->size(), 2u);
  for (const auto& [name, backend] : *backends) {
    EXPECT_EQ(backend->name(), name);
    EXPECT_EQ(backend->facts().sessionID, 4294967295u);
    EXPECT_EQ(backend->facts().compType, 11);
    EXPECT_EQ(backend->facts().clientVersion, 1);
    EXPECT_EQ(backend->facts().udid, String("device"));
    EXPECT_EQ(backend->facts().productVersion, String("17.1"));
    EXPECT_EQ(backend->facts().buildVersion, String("21B74"));
    EXPECT_EQ(backend->facts().hardwareType, String("Phone9,1"));
    EXPECT_EQ(backend->facts().productFamily, String("Phone"));
    EXPECT_TRUE(backend->facts().isInternal);
    EXPECT_TRUE(backend->facts().requireUserInfo);
    EXPECT_TRUE(backend->batchEvents());
    EXPECT_EQ(backend->userInfoDict(), userInfo);
    EXPECT_EQ(backend->facts().selfVersion, (std::array<uint8_t, 3>{9, 1, 2}));
    EXPECT_EQ(backend->facts().startTimeStamp, 100.5);
    EXPECT_EQ(backend->state(), kBackendStateUndecided);
    EXPECT_EQ(backend.use_count(), 1);
  }
}

TEST_F(BackendFactoryTest, WhatTheSessionInformationLacksReadsAsZero) {
  const auto backends = create(Dictionary{{kKYTReportingBackendDashboard, Dictionary{}}}, Dictionary{});
  const KYTReportingBackend& backend = *backends->find(kKYTReportingBackendDashboard);
  EXPECT_EQ(backend.facts().sessionID, 0u);
  EXPECT_EQ(backend.facts().compType, 0);
  EXPECT_EQ(backend.facts().clientVersion, 0);
  EXPECT_FALSE(backend.facts().requireUserInfo);
  EXPECT_FALSE(backend.batchEvents());
  EXPECT_FALSE(backend.userInfoDict());
}

TEST_F(BackendFactoryTest, ADaemonWithoutAVersionIs8) {
  platform_.daemonBundle.setVersion(std::nullopt);
  const auto backends = create(Dictionary{{kKYTReportingBackendDashboard, Dictionary{}}}, Dictionary{});
  const KYTReportingBackend& backend = *backends->find(kKYTReportingBackendDashboard);
  EXPECT_EQ(backend.facts().selfVersion, (std::array<uint8_t, 3>{8, 0, 0}));
}

TEST_F(BackendFactoryTest, KeepsTheOrderOfTheTable) {
  const auto backends = create(
      Dictionary{{kKYTReportingBackendQDX, Dictionary{}}, {kKYTReportingBackendDashboard, Dictionary{}}},
      Dictionary{});
  std::vector<std::string> names;
  for (const auto& [name, backend] : *backends) names.push_back(name.str());
  EXPECT_EQ(names, (std::vector<std::string>{"qdx", "dashboard"}));
  EXPECT_EQ(backends->find("httppost"), nullptr);
}

}  // namespace
}  // namespace kyt
