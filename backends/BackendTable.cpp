#include "backends/BackendTable.h"

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Keys.h"

namespace kyt {

std::vector<BackendCreator> backendTable(Configuration& configuration) {
  const BackendCreator::Create newHTTPSPostBackend =
      [&configuration](const String& name, const Dictionary& profile,
                       const std::optional<String>& productFamily, int32_t) {
        return HTTPSPostBackend::initWithName(configuration, name, profile, productFamily);
      };
  return {
      {kKYTReportingBackendHTTPPost, newHTTPSPostBackend},
      {kKYTReportingBackendHTTPPost2, newHTTPSPostBackend},
      {kKYTReportingBackendQRS, newHTTPSPostBackend},
  };
}

}  // namespace kyt
