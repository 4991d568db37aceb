#include "backend/PersistentIdentifier.h"

#include "platform/Platform.h"
#include "platform/RandomSource.h"
#include "platform/UserDefaults.h"
#include "platform/base/UUIDText.h"
#include "platform/objects/Keys.h"

namespace kyt {

String persistentIdentifier(Platform& platform, std::optional<uint32_t> owner, std::string_view key,
                            const String* made) {
  const Value stored = platform.userDefaults.value(kKYTReportingDefaultsDomain, key);
  if (const String* identifier = stored.string()) return *identifier;
  return platform.userDefaults.stringOrStore(
      kKYTReportingDefaultsDomain, key,
      made != nullptr ? *made : String(uuidText(platform.random.uuidBytes())), owner);
}

}  // namespace kyt
