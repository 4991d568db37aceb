#include "backends/BackendTable.h"

#include "backends/ampyx/AmpyxBackend.h"
#include "backends/dashboard/DashboardBackend.h"
#include "backends/https/HTTPSPostBackend.h"
#include "backends/qdx/QDXBackend.h"
#include "backends/upload/UploadBackend.h"
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
  const BackendCreator::Create newUploadBackend = [&configuration](
                                                      const String& name, const Dictionary& profile,
                                                      const std::optional<String>& productFamily, int32_t) {
    return UploadBackend::initWithName(configuration, name, profile, productFamily);
  };
  const BackendCreator::Create newAmpyxBackend = [&configuration](
                                                     const String& name, const Dictionary& profile,
                                                     const std::optional<String>& productFamily, int32_t) {
    return AmpyxBackend::initWithName(configuration, name, profile, productFamily);
  };
  const BackendCreator::Create newQDXBackend = [&configuration](const String& name, const Dictionary& profile,
                                                                const std::optional<String>& productFamily,
                                                                int32_t clientType) {
    return QDXBackend::initWithName(configuration, name, profile, productFamily, clientType);
  };
  return {
      {kKYTReportingBackendDashboard, newDashboardBackend},
      {kKYTReportingBackendUploadServer, newUploadBackend},
      {kKYTReportingBackendHTTPPost, newHTTPSPostBackend},
      {kKYTReportingBackendHTTPPost2, newHTTPSPostBackend},
      {kKYTReportingBackendAmpyx, newAmpyxBackend},
      {kKYTReportingBackendQRS, newHTTPSPostBackend},
      {kKYTReportingBackendQDX, newQDXBackend},
  };
}

}  // namespace kyt
