#include "backend/SessionFacts.h"

#include "backend/Text.h"

namespace kyt {

void SessionFacts::setSelfVersion(const String& version) {
  selfVersion = versionParts(version);
}

}  // namespace kyt
