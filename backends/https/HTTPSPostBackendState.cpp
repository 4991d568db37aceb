// What the storebag decides: which client entry is the session's, and what follows from it.
#include <algorithm>

#include "backend/Text.h"
#include "backends/https/HTTPSPostBackend.h"
#include "config/Environment.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

// Clients change their name and service rarely, if ever.
constexpr size_t kMostMadeIdentifiers = 16;

// Thresholds are shown as single-precision numbers: 0.615 as 0.62.
double asShown(const Value& threshold) {
  return static_cast<float>(threshold.doubleValue());
}

const String* textEntry(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr ? value->string() : nullptr;
}

const Array* arrayEntry(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr ? value->array() : nullptr;
}

int32_t intEntry(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr ? value->intValue() : 0;
}

// A comma-separated list. An empty text is a missing list; pieces are not trimmed, and an empty one matches
// nothing.
Array pieces(const String* list) {
  Array result;
  if (list == nullptr || list->empty()) return result;
  for (const std::string_view piece : splitText(*list, ",")) result.append(Value(piece));
  return result;
}

// What log lines show.
std::string shown(const String* text) {
  return text != nullptr ? text->str() : description(Value());
}
std::string shown(const Array* list) {
  return description(list != nullptr ? Value(*list) : Value());
}

// The threshold of the first element of the list whose countries hold this one; null when none does.
const Dictionary* countrySampling(const Dictionary& entry, const String* country) {
  const Array* thresholds = arrayEntry(entry, "per_country_sampling_thresholds");
  if (thresholds == nullptr || country == nullptr) return nullptr;
  for (const Value& element : *thresholds) {
    const Dictionary* threshold = element.dictionary();
    const Array* countries = threshold != nullptr ? arrayEntry(*threshold, "country") : nullptr;
    if (countries != nullptr &&
        std::find(countries->begin(), countries->end(), Value(*country)) != countries->end())
      return threshold;
  }
  return nullptr;
}

}  // namespace

bool HTTPSPostBackend::matchClientNameAndServiceID(const Dictionary& client, const String* clientName,
                                                   const String* serviceID) const {
  const Array names = pieces(textEntry(client, "client"));
  const Array services = pieces(textEntry(client, "service"));
  return matchExactStringWithList(&names, clientName, true) &&
         matchStringWithList(&services, serviceID, true);
}

bool HTTPSPostBackend::isFrameworkEnabledForClient(const Dictionary& client) const {
  const String* enabledSince = textEntry(client, "enabledSince");
  if (enabledSince == nullptr) return true;
  return facts().selfVersion >= versionParts(*enabledSince);
}

bool HTTPSPostBackend::updatePostLink(const Dictionary& client) {
  bool taken = false;
  if (!useDefaultPostURL_ || !postURL_) {
    useDefaultPostURL_ = false;
    if (const String* url = textEntry(client, "post_url")) {
      postURL_ = *url;
      taken = true;
      platform().log.debug("HTTPSPostBackend(updatePostLink): Storebag '%s' for postURL", url->c_str());
    }
  }
  if (!useDefaultRealtimePostURL_ || !realtimePostURL_) {
    useDefaultRealtimePostURL_ = false;
    if (const String* url = textEntry(client, "realtime_post_url")) {
      realtimePostURL_ = *url;
      platform().log.debug("HTTPSPostBackend(updatePostLink): Storebag '%s' for realtimePostURL",
                           url->c_str());
    } else {
      realtimePostURL_ = postURL_;
      platform().log.debug("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '%s'",
                           shown(postURL_ ? &*postURL_ : nullptr).c_str());
    }
  }
  return taken;
}

void HTTPSPostBackend::resetBackendStateWithClient(const Dictionary* client) {
  eventThreshold_ = client != nullptr ? intEntry(*client, "event_threshold") : 0;
  platform().log.debug("resetBackendStateWithClient: event_threshold set to %d", eventThreshold_);
  extrasOnInternal_ = client != nullptr ? intEntry(*client, "extras_on_internal") : 0;
  platform().log.debug("setBackendStateWithClient: extras on internal is set to %d", extrasOnInternal_);
}

void HTTPSPostBackend::updateState() {
  // A frozen state is not even written again: a reply may be disabling the back end at this moment.
  if (immutable_) return;
  setState(updateBackendState());
}

int32_t HTTPSPostBackend::updateBackendState() {
  if (immutable_) return state();
  const Array* clients = arrayEntry(profile(), "clients");
  if (clients == nullptr) return kBackendStateDisabled;
  const Client client{userInfoText(kKYTReportingUserInfoClientName),
                      userInfoText(kKYTReportingUserInfoServiceName)};
  applyExpedite(*clients, client);
  if (!facts().requireUserInfo) return enableWithoutUserInfo(*clients);
  if (!hasUserInfo()) return kBackendStateUndecided;
  const std::optional<String> country = platform().deviceProperties.countryCode();
  const Dictionary* entry = chosenEntry(*clients, client);
  if (entry == nullptr) tellWhyNot(Reason::clientNotListed, "no entry of the storebag is for this client");
  if (entry == nullptr || !passesRules(*entry, country ? &*country : nullptr)) return kBackendStateDisabled;
  const int32_t state = decideBySampling(*entry, country ? &*country : nullptr);
  takeSettings(*entry, client, state);
  return state;
}

// Deliberately without the version gate: an entry that is too new for this version still says whether to
// batch.
void HTTPSPostBackend::applyExpedite(const Array& clients, const Client& client) {
  for (const Value& element : clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr || !matchClientNameAndServiceID(*entry, client.name, client.service)) continue;
    if (entry->contains("expedite")) {
      setBatchEvents(intEntry(*entry, "expedite") == 0);
      platform().log.debug("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=%d",
                           batchEvents());
    }
    return;
  }
}

// No rule about consent, country, device, filters or sampling applies to a session without user information.
int32_t HTTPSPostBackend::enableWithoutUserInfo(const Array& clients) {
  const Dictionary* taken = nullptr;
  for (const Value& element : clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr || !updatePostLink(*entry)) continue;
    taken = entry;
    break;
  }
  resetBackendStateWithClient(taken);
  return kBackendStateEnabled;
}

const Dictionary* HTTPSPostBackend::chosenEntry(const Array& clients, const Client& client) const {
  for (const Value& element : clients) {
    const Dictionary* entry = element.dictionary();
    if (entry != nullptr && matchClientNameAndServiceID(*entry, client.name, client.service) &&
        isFrameworkEnabledForClient(*entry))
      return entry;
  }
  return nullptr;
}

bool HTTPSPostBackend::passesRules(const Dictionary& entry, const String* country) {
  if (!passesConsent(entry) || !passesLists(entry, country)) return false;
  const Array* filters = arrayEntry(entry, "filters");
  if (filters == nullptr) {
    platform().log.error("HTTPSPostBackend(updateBackendState): filters are required.");
    return false;
  }
  createFiltersFromArray(*filters);
  return true;
}

bool HTTPSPostBackend::passesConsent(const Dictionary& entry) {
  const int32_t overrideDnu = intEntry(entry, "override_dnu");
  if (overrideDnu == 1) {
    dnuType_ = dnuEnabled_ ? 2 : 1;
    return true;
  }
  dnuType_ = 0;
  if (dnuEnabled_) return true;
  platform().log.debug("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: %d.", overrideDnu);
  tellWhyNot(Reason::consentMissing, "the user has not given consent");
  return false;
}

bool HTTPSPostBackend::passesLists(const Dictionary& entry, const String* country) const {
  Log& log = platform().log;
  // The list is required, so it is matched by the rule that fails without one. By the same rule a device
  // whose country is not known passes: deliberate, servers count on hearing from those.
  const Array* locales = arrayEntry(entry, "locale_whitelist");
  if (!matchStringWithList(locales, country, false)) {
    if (log.debugEnabled())
      log.debug("HTTPSPostBackend(updateBackendState): (%s) isn't in country code list %s",
                shown(country).c_str(), shown(locales).c_str());
    tellWhyNot(Reason::countryNotListed, "the storebag's entry does not list this country");
    return false;
  }
  const String* family = facts().productFamily ? &*facts().productFamily : nullptr;
  const Array* devices = arrayEntry(entry, "device_whitelist");
  if (!matchStringWithList(devices, family, true)) {
    if (log.debugEnabled())
      log.debug("HTTPSPostBackend(updateBackendState): (%s) isn't in device whitelist %s",
                shown(family).c_str(), shown(devices).c_str());
    tellWhyNot(Reason::deviceNotListed, "the storebag's entry does not list this device");
    return false;
  }
  const String* hardware = facts().hardwareType ? &*facts().hardwareType : nullptr;
  const Array* excluded = arrayEntry(entry, "device_blacklist");
  if (matchStringWithList(excluded, hardware, false)) {
    if (log.debugEnabled())
      log.debug("HTTPSPostBackend(updateBackendState): (%s) is in device blacklist %s",
                shown(hardware).c_str(), shown(excluded).c_str());
    tellWhyNot(Reason::deviceNotListed, "the storebag's entry excludes this device");
    return false;
  }
  return true;
}

int32_t HTTPSPostBackend::decideBySampling(const Dictionary& entry, const String* country) {
  const Value* global = entry.find("sampling_threshold");
  Value threshold = global != nullptr ? *global : Value();
  if (const Dictionary* forCountry = countrySampling(entry, country)) {
    const Value* replacement = forCountry->find("threshold");
    Value changed = replacement != nullptr ? *replacement : Value();
    platform().log.debug(
        "HTTPSPostBackend(updateBackendState): sampling threshold for %s changed from %.02f to %.02f",
        country->c_str(), asShown(threshold), asShown(changed));
    threshold = std::move(changed);
  }
  setSamplingThreshold(threshold);
  if (threshold.isNull()) {
    tellWhyNot(Reason::samplingThresholdMissing, "the storebag's entry has no sampling_threshold");
    return kBackendStateDisabled;
  }
  if (samplingFactor() <= threshold.doubleValue()) return kBackendStateEnabled;
  tellWhyNot(Reason::sampledOut, "this session was not drawn");
  const Value* second = entry.find("override_sampling");
  overrideSampling_ = second != nullptr ? *second : Value();
  // "Greater than" and no other test: an override that is not a number holds the back end.
  if (!overrideSampling_.isNull() && samplingFactor() > overrideSampling_.doubleValue())
    return kBackendStateDisabled;
  return kBackendStateHeld;
}

void HTTPSPostBackend::takeSettings(const Dictionary& entry, const Client& client, int32_t state) {
  Log& log = platform().log;
  resetBackendStateWithClient(&entry);
  if (entry.contains("custom_clientId")) uuidCustom_ = getPersistentIdentifierForCustomClientIDSuffix(client);
  if (log.debugEnabled())
    log.debug("HTTPSPostBackend(updateBackendState): %s: client found %s:%s, state=%d, samplingFactor=%f",
              name().c_str(), shown(client.name).c_str(), shown(client.service).c_str(), state,
              samplingFactor());
  updatePostLink(entry);
  if (const Array* list = arrayEntry(entry, "event_whitelist")) {
    setEventWhitelist(*list);
    log.debugObjects("HTTPSPostBackend(updateBackendState): %s: eventWhitelist=%@",
                     {Value(name()), Value(*list)});
  }
  if (const Array* list = arrayEntry(entry, "event_blacklist")) {
    setEventBlacklist(*list);
    log.debugObjects("HTTPSPostBackend(updateBackendState): %s: eventBlacklist=%@",
                     {Value(name()), Value(*list)});
  }
  shouldUseWiFiOnly_ = intEntry(entry, "use_wifi_only") != 0;
}

// Each decision's own line is at the debug level; whoever runs the device sees one a minute without it.
void HTTPSPostBackend::tellWhyNot(Reason reason, const char* why) const {
  if (!platform().counters.addAndMayLog(reason, platform().clock.monotonic())) return;
  platform().log.normal("HTTPSPostBackend(updateBackendState): %s posts nothing of %s:%s, since %s",
                        name().c_str(), shown(userInfoText(kKYTReportingUserInfoClientName)).c_str(),
                        shown(userInfoText(kKYTReportingUserInfoServiceName)).c_str(), why);
}

String HTTPSPostBackend::getPersistentIdentifierForCustomClientIDSuffix(const Client& client) {
  const String empty;
  const std::string key =
      formatObjects("%@:%@:%@", {Value("uuid"), Value(client.name != nullptr ? *client.name : empty),
                                 Value(client.service != nullptr ? *client.service : empty)});
  const auto known = std::find_if(madeIdentifiers_.begin(), madeIdentifiers_.end(),
                                  [&](const auto& made) { return made.first == key; });
  String identifier = persistentIdentifier(key, known != madeIdentifiers_.end() ? &known->second : nullptr);
  if (known == madeIdentifiers_.end()) {
    if (madeIdentifiers_.size() >= kMostMadeIdentifiers) madeIdentifiers_.erase(madeIdentifiers_.begin());
    madeIdentifiers_.emplace_back(key, identifier);
  }
  platform().log.normal("getPersistentIdentifierForCustomClientIDSuffix: The value for %s: %s", key.c_str(),
                        platform().log.shownIdentifier(identifier).c_str());
  return identifier;
}

}  // namespace kyt
