#include "backend/SessionFacts.h"

#include "backend/Text.h"

namespace kyt {

void SessionFacts::setSelfVersion(const String& version) {
  selfVersion = versionParts(version);
}

std::string SessionFacts::versionSuffix() const {
  return selfVersion[2] != 0 ? "." + std::to_string(selfVersion[2]) : std::string();
}

}  // namespace kyt
