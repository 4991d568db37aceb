// The ring of a device, and the address from which it takes its storebags.
#include <cstdio>

#include "platform/DeviceProperties.h"
#include "platform/UserDefaults.h"
#include "platform/base/TextEscape.h"
#include "tools/Ring.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/DevicePorts.h"

namespace kyt::tools {

int ringCommand(const std::string& root, const RingOptions& options) {
  DevicePorts ports(root, false);
  std::string identifier = options.identifier;
  if (identifier.empty()) {
    const std::optional<String> own = ports.device(true).deviceProperties.property("UniqueDeviceID");
    if (!own) return failed("this device has no identifier (UniqueDeviceID)");
    identifier = own->str();
  }
  const uint32_t ring = ringOf(identifier, ports.cryptography());
  if (options.address.empty()) {
    std::printf("%s\n", ringText(ring).c_str());
    return 0;
  }
  const std::optional<std::string> address = addressOfRing(options.address, ring);
  if (!address) return failed("the address has no \"{ring}\"");
  if (!address->starts_with("https://") && !address->starts_with("http://"))
    return failed("\"" + options.address + "\" is no address");
  std::printf("%s %s\n", ringText(ring).c_str(), escapedText(*address).c_str());
  return defaultsWriteCommand(root, kKYTReportingDefaultsDomain, "kytreporting_storebag_url", "string",
                              address);
}

}  // namespace kyt::tools
