// Preferences by domain and key, readable and changeable by an administrator while the daemon runs.
//
// Callers: the environment and storebag address, the HTTPS back end's overrides and identifiers, the consent. Any
// thread; reads block for a stat() at most, and for a small file read after a change; set() for a write and rename.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>
#include <utility>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt {

inline constexpr char kKYTReportingDefaultsDomain[] = "com.vantu.kytreporting";
inline constexpr char kDiagnosticsDefaultsDomain[] = "com.vantu.diagnostics";
inline constexpr char kTimedDefaultsDomain[] = "com.vantu.timed";
inline constexpr char kStorebagDefaultsDomain[] = "com.vantu.kytreporting.storebags";  // name to serial

class UserDefaults {
 public:
  virtual ~UserDefaults() = default;
  // Strings, booleans, integers and doubles; null when the key has no value or the file cannot be read.
  [[nodiscard]] virtual Value value(std::string_view domain, std::string_view key) = 0;
  // A null value removes the key. Replaces the file atomically; an error leaves what was there.
  [[nodiscard]] virtual std::optional<Error> set(std::string_view domain, std::string_view key,
                                                 Value value) = 0;
  // Stores `value` unless the key already has a string; returns what is stored afterwards, also under concurrent
  // callers of other processes. On an error returns `value`, unstored (counted and logged by the adapter). `owner` is the
  // user for whose client it is made, who has a share of the identifiers that are kept; none: the daemon's own.
  [[nodiscard]] virtual String stringOrStore(std::string_view domain, std::string_view key, String value,
                                             std::optional<uint32_t> owner) = 0;
  [[nodiscard]] String stringOrStore(std::string_view domain, std::string_view key, String value) {
    return stringOrStore(domain, key, std::move(value), std::nullopt);
  }
};

}  // namespace kyt
