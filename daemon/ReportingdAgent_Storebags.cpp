// The storebag cache: one entry for each storebag name, never removed. A failed refresh keeps the last good
// section and is not tried again for a while, so that a server in trouble is not stormed.
#include <cmath>
#include <utility>
#include <variant>

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
  return info ? info->integer(kKYTReportingSessionInfoClientType) : 0;
}

std::optional<String> stringEntry(const Dictionary& entry, const char* key) {
  const String* text = entry.string(key);
  return text != nullptr ? std::optional(*text) : std::nullopt;
}

std::optional<Dictionary> sectionOf(const Dictionary& entry) {
  const Dictionary* section = entry.dictionary(kData);
  return section != nullptr ? std::optional(*section) : std::nullopt;
}

// Whether the entry is used as it is, with the reason in the log: it is fresh, or it failed a short while ago.
bool entryHolds(const Dictionary& entry, int32_t clientType, Platform& platform) {
  const double fetchTime = entry.find(kFetchTime)->date().value_or(Date()).secondsSince1970;
  const double age = std::fabs(platform.clock.timeOfDay().asSeconds() - fetchTime);
  const bool fresh = stringEntry(entry, kFetchState) == String(kSuccessful);
  if (fresh && age < entry.find(kMaxAge)->intValue()) {
    platform.log.debug("storebagForSession: Cached storebag found for client type %d", clientType);
    return true;
  }
  if (!fresh && age < kStorebagRetrySeconds) {
    platform.log.normal(
        "storebagForSession: Not fetching storebag for client type %d - must wait %d seconds between attempts",
        clientType, kStorebagRetrySeconds);
    return true;
  }
  return false;
}

}  // namespace

const Dictionary* ReportingdAgent::cachedEntry(const std::optional<String>& name) const {
  return name ? _cachedStorebags.dictionary(*name) : nullptr;
}

std::optional<Dictionary> ReportingdAgent::storebagForSession(ReportingdSession& session) {
  Platform& platform = configuration_.platform;
  const int32_t clientType = clientTypeOf(session);
  const std::optional<String> name = storebagNameForClientType(clientType);
  platform.log.debug("storebagForSession: Retrieving storebag for session %u with client type %d",
                     session.sessionID(), clientType);
  MonitorLock lock(monitor_);
  const Dictionary* entry = cachedEntry(name);
  if (entry != nullptr && entryHolds(*entry, clientType, platform)) return sectionOf(*entry);
  return fetchAndCacheStorebag(clientType, name, entry);
}

std::optional<String> ReportingdAgent::storebagVersionForSession(ReportingdSession& session) {
  MonitorLock lock(monitor_);
  const Dictionary* entry = cachedEntry(storebagNameForClientType(clientTypeOf(session)));
  return entry != nullptr ? stringEntry(*entry, kVersion) : std::nullopt;
}

std::optional<Dictionary> ReportingdAgent::fetchAndCacheStorebag(int32_t clientType,
                                                                 const std::optional<String>& name,
                                                                 const Dictionary* existing) {
  Log& log = configuration_.platform.log;
  log.debug("fetchAndCacheStorebag: Fetching storebag for client type %d", clientType);
  if (!name) {
    log.error("fetchAndCacheStorebag: clientType %d is invalid", clientType);
    return std::nullopt;
  }
  Dictionary entry;
  if (existing != nullptr) entry = *existing;
  StorebagFetcher::Fetch<StorebagFetcher::Section> fetch =
      fetcher_.fetchStorebagForEnvironmentAndClientType(clientType, stringEntry(entry, kLastModified));
  log.debug("fetchAndCacheStorebag: Storebag max age: %d seconds", fetch.maxAge);
  const bool failed = std::holds_alternative<StorebagFetcher::Failed>(fetch.result);
  if (failed) log.error("fetchAndCacheStorebag: Unable to fetch storebag for client type %d", clientType);
  if (auto* section = std::get_if<StorebagFetcher::Section>(&fetch.result)) {
    entry.set(kData, std::move(section->contents));
    entry.set(kVersion, std::move(section->version));
  }
  entry.set(kFetchTime, Date{configuration_.platform.clock.timeOfDay().asSeconds()});
  entry.set(kFetchState, failed ? kFailure : kSuccessful);
  entry.set(kMaxAge, fetch.maxAge);
  if (fetch.lastModified) entry.set(kLastModified, std::move(*fetch.lastModified));
  const auto now = static_cast<int64_t>(configuration_.platform.clock.timeOfDay().asSeconds());
  const std::optional<String> version = stringEntry(entry, kVersion);
  std::optional<Dictionary> section = sectionOf(entry);
  storebags_.publish({.name = name->str(),
                      .version = version ? version->str() : std::string(),
                      .address = std::move(fetch.address),
                      .fetched = now,
                      .expires = now + (failed ? kStorebagRetrySeconds : fetch.maxAge),
                      .state = failed                  ? StorebagView::State::failed
                               : fetch.problem.empty() ? StorebagView::State::good
                                                       : StorebagView::State::fallback,
                      .lastError = fetch.problem,
                      .lastErrorAt = fetch.problem.empty() ? 0 : now,
                      .section = section.value_or(Dictionary())});
  _cachedStorebags.set(*name, std::move(entry));
  cachedStorebagsSize_.reset();
  return section;
}

}  // namespace kyt
