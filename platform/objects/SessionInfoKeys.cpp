#include "platform/objects/SessionInfoKeys.h"

#include <algorithm>

#include "platform/objects/Keys.h"

namespace kyt {

namespace {

using Kind = SessionInfoKey::Kind;

constexpr SessionInfoKey kSessionInfo[] = {{kKYTReportingSessionInfoSessionID, Kind::number, UINT32_MAX},
                                           {kKYTReportingSessionInfoClientType, Kind::number, 23},
                                           {kKYTReportingSessionInfoClientVersion, Kind::number, UINT16_MAX},
                                           {kKYTReportingSessionInfoBatchEvent, Kind::boolean},
                                           {kKYTReportingSessionInfoRequireUserInfo, Kind::boolean},
                                           {kKYTReportingSessionInfoHierarchyToken, Kind::dictionary}};
constexpr SessionInfoKey kHierarchyToken[] = {{kKYTReportingHierarchyTokenTokenID, Kind::text},
                                              {kKYTReportingHierarchyTokenLevel, Kind::number, UINT32_MAX}};

}  // namespace

const SessionInfoKey* SessionInfoKey::find(std::span<const SessionInfoKey> keys, std::string_view key) {
  const auto found =
      std::find_if(keys.begin(), keys.end(), [key](const SessionInfoKey& one) { return key == one.key; });
  return found != keys.end() ? &*found : nullptr;
}

std::span<const SessionInfoKey> sessionInfoKeys() {
  return kSessionInfo;
}

std::span<const SessionInfoKey> hierarchyTokenKeys() {
  return kHierarchyToken;
}

}  // namespace kyt
