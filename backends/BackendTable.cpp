#include "backends/BackendTable.h"

#include "backends/ampyx/AmpyxBackend.h"
#include "backends/dashboard/DashboardBackend.h"
#include "backends/https/HTTPSPostBackend.h"
#include "backends/qdx/QDXBackend.h"
#include "backends/upload/UploadBackend.h"
#include "platform/objects/Keys.h"

namespace kyt {

std::vector<BackendCreator> backendTable(Configuration& configuration) {
  const BackendCreator::Create newHTTPSPostBackend =
      [&configuration](const String& name, const Dictionary& profile, const SharedSessionFacts& facts) {
        return HTTPSPostBackend::initWithName(configuration, name, profile, facts);
      };
  const BackendCreator::Create newDashboardBackend =
      [&configuration](const String& name, const Dictionary& profile, const SharedSessionFacts& facts) {
        return DashboardBackend::initWithName(configuration.platform, name, profile, facts);
      };
  const BackendCreator::Create newUploadBackend =
      [&configuration](const String& name, const Dictionary& profile, const SharedSessionFacts& facts) {
        return UploadBackend::initWithName(configuration, name, profile, facts);
      };
  const BackendCreator::Create newAmpyxBackend =
      [&configuration](const String& name, const Dictionary& profile, const SharedSessionFacts& facts) {
        return AmpyxBackend::initWithName(configuration, name, profile, facts);
      };
  const BackendCreator::Create newQDXBackend = [&configuration](const String& name, const Dictionary& profile,
                                                                const SharedSessionFacts& facts) {
    return QDXBackend::initWithName(configuration, name, profile, facts);
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
