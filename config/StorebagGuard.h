// Refuses storebags that verify and still should not count: old ones that somebody plays back, those past their time, those
// signed over SHA-1 alone. Each of the three only where the administrator says so (`StorebagRefusals`); otherwise nothing
// of a bag is looked at here, and nothing is stored.
//
// The serial of the last bag that was taken, by the storebag's name, outlives the daemon as a user default of the domain
// kStorebagDefaultsDomain: who publishes bags anew from 1 removes it there. The fetcher is the only caller, one fetch of a
// name at a time. A call may block for the writing of a small file.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "platform/Platform.h"
#include "platform/base/Mutex.h"
#include "platform/base/Settings.h"
#include "platform/objects/Value.h"

namespace kyt {

inline constexpr char kStorebagSerial[] = "serial";              // in the bag: a whole number
inline constexpr char kStorebagExpires[] = "expires";            // in the bag: a date, or seconds since 1970
inline constexpr char kStorebagSignature256[] = "signature256";  // beside "signature"

// None: there is none, or it is neither a date nor a number.
[[nodiscard]] std::optional<double> storebagExpiry(const Dictionary& bag);  // seconds since 1970
[[nodiscard]] std::optional<int64_t> storebagSerial(const Dictionary& bag);

class StorebagGuard {
 public:
  StorebagGuard(Platform& platform, StorebagRefusals refusals) : platform_(platform), refusals_(refusals) {}

  [[nodiscard]] bool requiresSHA256() const { return refusals_.withoutSHA256; }
  // Why this bag is refused, for people; none: it may be taken.
  [[nodiscard]] std::optional<std::string> refusal(const String& name, const Dictionary& bag);
  // Why the bag that was taken last holds no more although its server says so; none: it does.
  [[nodiscard]] std::optional<std::string> refusalOfTheLast(const String& name);
  // It was taken: older ones are refused from now on.
  void taken(const String& name, const Dictionary& bag);

 private:
  [[nodiscard]] std::optional<std::string> refusalByTime(std::optional<double> expires) const;
  [[nodiscard]] std::optional<int64_t> lastSerial(const String& name);

  Platform& platform_;
  const StorebagRefusals refusals_;
  Mutex mutex_;
  // Of this process, should the file not be writable.
  std::map<std::string, int64_t> serials_ GUARDED_BY(mutex_);
  std::map<std::string, double> expiries_ GUARDED_BY(mutex_);
};

}  // namespace kyt
