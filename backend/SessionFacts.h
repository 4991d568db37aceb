// What a back end is told of its session, of the device and of the daemon when it is made. Made by the factory once
// for all back ends of a session, which share it; constant from then on, so any thread may read it, also one that
// outlives the session.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/base/Clock.h"
#include "platform/objects/Value.h"

namespace kyt {

struct SessionFacts {
  uint32_t sessionID = 0;
  int32_t compType = 0;  // the client's type
  uint16_t clientVersion = 0;
  // What the session asked for.
  bool requireUserInfo = false, batchEvents = false;
  // The device. What is not known is missing.
  bool isInternal = false;
  std::optional<String> udid;
  std::optional<String> productVersion, buildVersion, hardwareType, productFamily;
  // The daemon's version: major, middle, minor.
  std::array<uint8_t, 3> selfVersion{};
  double startTimeStamp = 0;  // seconds since 1970

  // "major.middle.minor"; missing or unreadable parts are 0, each is kept modulo 256.
  void setSelfVersion(const String& version);
  // As records and requests have it: "3.1", or "3.1.2".
  [[nodiscard]] std::string versionText() const {
    return std::to_string(selfVersion[0]) + "." + std::to_string(selfVersion[1]) + versionSuffix();
  }
  // "." and the minor, or nothing when that is 0.
  [[nodiscard]] std::string versionSuffix() const;
  void setStartTimestamp(const TimeValue& timestamp) { startTimeStamp = timestamp.asSeconds(); }
};

using SharedSessionFacts = std::shared_ptr<const SessionFacts>;

}  // namespace kyt
