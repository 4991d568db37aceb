#include "backends/BackendTable.h"

#include "backends/dashboard/DashboardBackend.h"
#include "backends/https/HTTPSPostBackend.h"
#include "platform/Keys.h"

namespace kyt {

std::vector<BackendCreator> backendTable(Configuration& configuration) {
  const BackendCreator::Create newHTTPSPostBackend =
      [&configuration](const String& name, const Dictionary& profile,
                       const std::optional<String>& productFamily, int32_t) {
        return HTTPSPostBackend::initWithName(configuration, name, profile, productFamily);
      };
  const BackendCreator::Create newDashboardBackend =
      [&configuration](const String& name, const Dictionary& profile,
                       const std::optional<String>& productFamily, int32_t) {
        return DashboardBackend::initWithName(configuration.platform, name, profile, productFamily);
      };
  return {
      {kKYTReportingBackendDashboard, newDashboardBackend},
      {kKYTReportingBackendHTTPPost, newHTTPSPostBackend},
      {kKYTReportingBackendHTTPPost2, newHTTPSPostBackend},
      {kKYTReportingBackendQRS, newHTTPSPostBackend},
  };
}

}  // namespace kyt
