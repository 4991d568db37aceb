// The values that the sessions of one hierarchy share, by hierarchy token. They stay for the life of the
// process, so what one user's sessions put in is limited: each value is charged to the user who last wrote
// it, and an update that would pass the limit is refused as a whole. Used by the agent alone, which holds its
// monitor.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "platform/base/UserBudget.h"
#include "platform/objects/Value.h"

namespace kyt {

class SharedDataStore {
 public:
  explicit SharedDataStore(UserBudget& budget) : budget_(budget) {}

  // Merges the entries in; false when they would pass the user's limit (nothing is changed then).
  [[nodiscard]] bool update(const String& token, const Dictionary& sharedData, uint32_t user);
  void removeObject(const String& token, const String& key);
  void removeToken(const String& token);
  // None when nothing was ever shared under the token.
  [[nodiscard]] std::optional<Dictionary> dictionary(const String& token) const;
  [[nodiscard]] uint64_t bytesOfUser(uint32_t user) const;

 private:
  struct Charge {
    uint32_t user = 0;
    uint64_t bytes = 0;
  };
  struct Shared {
    Charge token;  // of the one who shared first
    Dictionary values;
    std::map<std::string, Charge, std::less<>> charges;
  };
  void credit(const Charge& charge);
  [[nodiscard]] static bool take(UserAccount& account, uint64_t added, uint64_t credited);

  UserBudget& budget_;
  std::map<std::string, Shared, std::less<>> byToken_;
};

}  // namespace kyt
