// The storebag cache: one entry for each storebag name, never removed. A failed refresh keeps the last good
// section and is not tried again for a while, so that a server in trouble is not stormed.
#include <cmath>
#include <utility>

#include "config/ClientTypes.h"
#include "config/StorebagFetcher.h"
#include "daemon/ReportingdAgent.h"
#include "platform/Platform.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "session/ReportingdSession.h"

namespace kyt {

namespace {

constexpr char kData[] = "StorebagData";
constexpr char kVersion[] = "StorebagVersion";
constexpr char kFetchTime[] = "StorebagFetchTime";
constexpr char kFetchState[] = "StorebagFetchState";
constexpr char kMaxAge[] = "StorebagMaxAge";
constexpr char kLastModified[] = "StorebagLastModified";
constexpr char kSuccessful[] = "Fetch Successful";
constexpr char kFailure[] = "Fetch Failure";

int32_t clientTypeOf(const ReportingdSession& session) {
  const std::optional<Dictionary>& info = session.sessionInfo();
  const Value* type = info ? info->find(kKYTReportingSessionInfoClientType) : nullptr;
  return type != nullptr ? type->intValue() : 0;
}

std::optional<String> stringEntry(const Dictionary& entry, const char* key) {
  const Value* value = entry.find(key);
  if (value == nullptr || value->string() == nullptr) return std::nullopt;
  return *value->string();
}

}  // namespace

const Dictionary* ReportingdAgent::cachedEntry(const std::optional<String>& name) const {
  const Value* entry = name ? _cachedStorebags.find(*name) : nullptr;
  return entry != nullptr ? entry->dictionary() : nullptr;
}

std::optional<Dictionary> ReportingdAgent::cachedData(const std::optional<String>& name) const {
  const Dictionary* entry = cachedEntry(name);
  const Value* data = entry != nullptr ? entry->find(kData) : nullptr;
  if (data == nullptr || !data->isDictionary()) return std::nullopt;
  return *data->dictionary();
}

std::optional<Dictionary> ReportingdAgent::storebagForSession(ReportingdSession& session) {
  Log& log = configuration_.platform.log;
  const int32_t clientType = clientTypeOf(session);
  const std::optional<String> name = storebagNameForClientType(clientType);
  log.debug("storebagForSession: Retrieving storebag for session %u with client type %d", session.sessionID(),
            clientType);
  MonitorLock lock(monitor_);
  if (const Dictionary* entry = cachedEntry(name)) {
    const double fetchTime = entry->find(kFetchTime)->date().value_or(Date()).secondsSince1970;
    const double age = std::fabs(configuration_.platform.clock.timeOfDay().asSeconds() - fetchTime);
    const bool fresh = stringEntry(*entry, kFetchState) == String(kSuccessful);
    if (fresh && age < entry->find(kMaxAge)->intValue()) {
      log.debug("storebagForSession: Cached storebag found for client type %d", clientType);
      return cachedData(name);
    }
    if (!fresh && age < kStorebagRetrySeconds) {
      log.normal(
          "storebagForSession: Not fetching storebag for client type %d - must wait %d seconds between attempts",
          clientType, kStorebagRetrySeconds);
      return cachedData(name);
    }
  }
  fetchAndCacheStorebag(clientType);
  return cachedData(name);
}

std::optional<String> ReportingdAgent::storebagVersionForSession(ReportingdSession& session) {
  MonitorLock lock(monitor_);
  const Dictionary* entry = cachedEntry(storebagNameForClientType(clientTypeOf(session)));
  return entry != nullptr ? stringEntry(*entry, kVersion) : std::nullopt;
}

void ReportingdAgent::fetchAndCacheStorebag(int32_t clientType) {
  Log& log = configuration_.platform.log;
  log.debug("fetchAndCacheStorebag: Fetching storebag for client type %d", clientType);
  const std::optional<String> name = storebagNameForClientType(clientType);
  if (!name) {
    log.error("fetchAndCacheStorebag: clientType %d is invalid", clientType);
    return;
  }
  Dictionary entry;
  if (const Dictionary* existing = cachedEntry(name)) entry = *existing;
  int32_t maxAge = 0;  // what an unreachable server leaves
  bool notModified = false;
  std::optional<String> version;
  std::optional<String> lastModified = stringEntry(entry, kLastModified);
  std::optional<Dictionary> section = fetcher_.fetchStorebagForEnvironmentAndClientType(
      clientType, maxAge, version, notModified, &lastModified);
  log.debug("fetchAndCacheStorebag: Storebag max age: %d seconds", maxAge);
  const bool successful = section || notModified;
  if (section) {
    entry.set(kData, std::move(*section));
    if (version) entry.set(kVersion, *version);
  } else if (!notModified) {
    log.error("fetchAndCacheStorebag: Unable to fetch storebag for client type %d", clientType);
  }
  entry.set(kFetchTime, Date{configuration_.platform.clock.timeOfDay().asSeconds()});
  entry.set(kFetchState, successful ? kSuccessful : kFailure);
  entry.set(kMaxAge, maxAge);
  if (lastModified) entry.set(kLastModified, *lastModified);
  _cachedStorebags.set(*name, std::move(entry));
  cachedStorebagsSize_.reset();
}

}  // namespace kyt
