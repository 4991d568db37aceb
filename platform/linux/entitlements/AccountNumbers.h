// The numbers of users and groups that grants name. A name is looked up each time, since a user may be made after the
// file was written. Where the system refuses to look (no descriptor is left, no memory, a disk that fails), the number
// that was found last under that name counts: such a refusal says nothing about the user.
//
// Any thread; nothing is locked during a look-up. At most kMostRemembered names of each kind are remembered, and all of
// them forgotten when there are more.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>

#include "platform/base/Mutex.h"
#include "platform/linux/entitlements/EntitlementsFile.h"

namespace kyt {

class AccountNumbers {
 public:
  static constexpr size_t kMostRemembered = 1024;  // administrators write the names; some 100 KiB
  // Looks up who has the name. Returns 0, or errno where it could not look; `found` is left empty when nobody has it.
  using LookUp = int (*)(const std::string& name, std::optional<uint32_t>& found);

  AccountNumbers();                             // asks the system
  AccountNumbers(LookUp users, LookUp groups);  // for tests

  // None when nobody has that name, or nothing is known of it.
  [[nodiscard]] std::optional<uint32_t> user(const NameOrNumber& user);
  [[nodiscard]] std::optional<uint32_t> group(const NameOrNumber& group);

 private:
  class Remembered {
   public:
    explicit Remembered(LookUp lookUp) : lookUp_(lookUp) {}
    [[nodiscard]] std::optional<uint32_t> numberOf(const NameOrNumber& who) EXCLUDES(mutex_);

   private:
    const LookUp lookUp_;
    Mutex mutex_;
    std::map<std::string, uint32_t, std::less<>> numbers_ GUARDED_BY(mutex_);
  };
  Remembered users_, groups_;
};

}  // namespace kyt
