#include "config/StorebagGuard.h"

#include <algorithm>

#include "platform/UserDefaults.h"
#include "platform/base/Clock.h"
#include "platform/objects/Description.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

bool isNumber(const Value& value) {
  return value.kind() == Value::Kind::integer || value.kind() == Value::Kind::unsignedInteger ||
         value.kind() == Value::Kind::real;
}

}  // namespace

std::optional<double> storebagExpiry(const Dictionary& bag) {
  const Value* expires = bag.find(kStorebagExpires);
  if (expires == nullptr) return std::nullopt;
  if (const std::optional<Date> date = expires->date()) return date->secondsSince1970;
  return isNumber(*expires) ? std::optional(expires->doubleValue()) : std::nullopt;
}

std::optional<int64_t> storebagSerial(const Dictionary& bag) {
  const Value* serial = bag.find(kStorebagSerial);
  if (serial == nullptr || serial->kind() == Value::Kind::real || !isNumber(*serial)) return std::nullopt;
  return serial->longLongValue();
}

std::optional<std::string> StorebagGuard::refusalByTime(std::optional<double> expires) const {
  if (!expires || platform_.clock.timeOfDay().asSeconds() < *expires) return std::nullopt;
  return "it expired at " + description(Value(Date{*expires}));
}

std::optional<int64_t> StorebagGuard::lastSerial(const String& name) {
  const Value stored = platform_.userDefaults.value(kStorebagDefaultsDomain, name.view());
  std::optional<int64_t> last;
  if (isNumber(stored)) last = stored.longLongValue();
  MutexLock lock(mutex_);
  const auto known = serials_.find(name.str());
  if (known != serials_.end()) last = std::max(last.value_or(known->second), known->second);
  return last;
}

std::optional<std::string> StorebagGuard::refusal(const String& name, const Dictionary& bag) {
  if (refusals_.older) {
    const std::optional<int64_t> last = lastSerial(name), serial = storebagSerial(bag);
    const std::string taken =
        last ? "; one with the serial " + std::to_string(*last) + " was taken before" : "";
    if (last && !serial) return "it has no serial" + taken;
    if (last && *serial < *last) return "its serial is " + std::to_string(*serial) + taken;
  }
  if (!refusals_.expired) return std::nullopt;
  const std::optional<double> expires = storebagExpiry(bag);
  if (!expires && bag.contains(kStorebagExpires)) return "its \"expires\" is neither a date nor a number";
  return refusalByTime(expires);
}

std::optional<std::string> StorebagGuard::refusalOfTheLast(const String& name) {
  if (!refusals_.expired) return std::nullopt;
  std::optional<double> expires;
  {
    MutexLock lock(mutex_);
    const auto known = expiries_.find(name.str());
    if (known != expiries_.end()) expires = known->second;
  }
  return refusalByTime(expires);
}

void StorebagGuard::taken(const String& name, const Dictionary& bag) {
  if (refusals_.expired) {
    const std::optional<double> expires = storebagExpiry(bag);
    MutexLock lock(mutex_);
    expiries_.erase(name.str());
    if (expires) expiries_[name.str()] = *expires;
  }
  const std::optional<int64_t> serial = storebagSerial(bag);
  if (!refusals_.older || !serial || lastSerial(name) == serial) return;
  {
    MutexLock lock(mutex_);
    serials_[name.str()] = *serial;
  }
  const auto error = platform_.userDefaults.set(kStorebagDefaultsDomain, name.view(), Value(*serial));
  if (error)
    platform_.log.normal(
        "fetchStorebagWithName: The serial of '%s' could not be stored, older ones count after a restart: %s",
        name.c_str(), error->localizedDescription.c_str());
}

}  // namespace kyt
