// Which class stands under which name.
#include "backends/BackendTable.h"

#include <gtest/gtest.h>

#include "backends/ampyx/AmpyxBackend.h"
#include "backends/dashboard/DashboardBackend.h"
#include "backends/https/HTTPSPostBackend.h"
#include "backends/qdx/QDXBackend.h"
#include "backends/upload/UploadBackend.h"
#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

TEST(BackendTable, ThreeNamesStandForTheHTTPSBackEndEachWithItsOwnProfile) {
  TestPlatform platform;
  DefaultBackendFactory factory(platform.configuration, backendTable(platform.configuration));
  const Array clients{Dictionary{}};
  Dictionary table;
  for (const char* name :
       {kKYTReportingBackendHTTPPost, kKYTReportingBackendHTTPPost2, kKYTReportingBackendQRS})
    table.set(name, Dictionary{{"clients", clients}, {"display_url", std::string("https://") + name}});
  const std::optional<Backends> backends = factory.createBackends(table, Dictionary{}, std::nullopt, "");
  ASSERT_TRUE(backends);
  ASSERT_EQ(backends->size(), 3u);
  for (const auto& [name, backend] : *backends) {
    EXPECT_NE(dynamic_cast<HTTPSPostBackend*>(backend.get()), nullptr) << name.view();
    EXPECT_EQ(backend->name(), name);
    EXPECT_EQ(backend->displayURL(), String("https://" + name.str()));
  }
}

TEST(BackendTable, TheDashboardHasAClassOfItsOwnAndComesFirst) {
  TestPlatform platform;
  EXPECT_EQ(backendTable(platform.configuration).front().name, kKYTReportingBackendDashboard);
  DefaultBackendFactory factory(platform.configuration, backendTable(platform.configuration));
  const Dictionary table{{kKYTReportingBackendHTTPPost, Dictionary{{"clients", Array{}}}},
                         {kKYTReportingBackendDashboard, Dictionary{{"ip", "192.0.2.7"}, {"port", 4000}}}};
  const auto backends = factory.createBackends(table, Dictionary{}, std::nullopt, "");
  ASSERT_TRUE(backends);
  ASSERT_EQ(backends->size(), 2u);
  EXPECT_NE(dynamic_cast<HTTPSPostBackend*>(backends->find(kKYTReportingBackendHTTPPost)), nullptr);
  EXPECT_NE(dynamic_cast<DashboardBackend*>(backends->find(kKYTReportingBackendDashboard)), nullptr);
}

TEST(BackendTable, ADashboardWithoutAServerIsNoBackEnd) {
  TestPlatform platform;
  DefaultBackendFactory factory(platform.configuration, backendTable(platform.configuration));
  const auto backends = factory.createBackends(Dictionary{{kKYTReportingBackendDashboard, Dictionary{}}},
                                               Dictionary{}, std::nullopt, "");
  ASSERT_TRUE(backends);
  EXPECT_TRUE(backends->empty());
  EXPECT_TRUE(platform.sink.contains("DashboardBackend(initWithName): can't resolve server IP"));
}

TEST(BackendTable, EachOtherNameStandsForItsOwnClass) {
  TestPlatform platform;
  DefaultBackendFactory factory(platform.configuration, backendTable(platform.configuration));
  const auto make = [&](const char* name) {
    SessionFacts facts;
    facts.compType = 7;
    return factory.newBackendWithName(name, Dictionary{{"post_url", "https://u"}},
                                      std::make_shared<SessionFacts>(facts));
  };
  EXPECT_NE(dynamic_cast<UploadBackend*>(make(kKYTReportingBackendUploadServer).get()), nullptr);
  EXPECT_NE(dynamic_cast<AmpyxBackend*>(make(kKYTReportingBackendAmpyx).get()), nullptr);
  EXPECT_NE(dynamic_cast<QDXBackend*>(make(kKYTReportingBackendQDX).get()), nullptr);
}

TEST(BackendTable, NamesAreComparedInTheirOrder) {
  TestPlatform platform;
  std::vector<std::string> names;
  for (const BackendCreator& creator : backendTable(platform.configuration))
    names.push_back(creator.name.str());
  EXPECT_EQ(names, (std::vector<std::string>{kKYTReportingBackendDashboard, kKYTReportingBackendUploadServer,
                                             kKYTReportingBackendHTTPPost, kKYTReportingBackendHTTPPost2,
                                             kKYTReportingBackendAmpyx, kKYTReportingBackendQRS,
                                             kKYTReportingBackendQDX}));
}

TEST(BackendTable, AProfileThatIsNoDictionaryMakesNoBackEnd) {
  TestPlatform platform;
  DefaultBackendFactory factory(platform.configuration, backendTable(platform.configuration));
  const auto backends = factory.createBackends(Dictionary{{kKYTReportingBackendHTTPPost, "all"}},
                                               Dictionary{}, std::nullopt, "");
  ASSERT_TRUE(backends);
  EXPECT_TRUE(backends->empty());
}

}  // namespace
}  // namespace kyt
