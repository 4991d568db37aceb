// Which class stands under which name.
#include "backends/BackendTable.h"

#include <gtest/gtest.h>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Keys.h"
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
