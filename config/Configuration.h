// What the folders above platform/ are configured with: the ports, and the two process-wide objects that say
// who the device is and in which environment it runs. The composition root owns all three; they outlive
// everything else.
#pragma once

namespace kyt {

class DeviceIdentity;
class Environment;
struct Platform;

struct Configuration {
  Platform& platform;
  DeviceIdentity& deviceIdentity;
  Environment& environment;
};

}  // namespace kyt
