#include "backends/https/ClientRules.h"

#include <algorithm>

#include "backend/KYTReportingBackend.h"
#include "backend/PersistentIdentifier.h"
#include "backend/Text.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
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

Value valueOf(const String* text) {
  return text != nullptr ? Value(*text) : Value();
}
Value valueOf(const Array* list) {
  return list != nullptr ? Value(*list) : Value();
}

// The threshold of the first element of the list whose countries hold this one; null when none does.
const Dictionary* countrySampling(const Dictionary& entry, const String* country) {
  const Array* thresholds = entry.array("per_country_sampling_thresholds");
  if (thresholds == nullptr || country == nullptr) return nullptr;
  for (const Value& element : *thresholds) {
    const Dictionary* threshold = element.dictionary();
    const Array* countries = threshold != nullptr ? threshold->array("country") : nullptr;
    if (countries != nullptr &&
        std::find(countries->begin(), countries->end(), Value(*country)) != countries->end())
      return threshold;
  }
  return nullptr;
}

}  // namespace

ClientRules::ClientRules(Platform& platform, Facts facts) : platform_(platform), facts_(std::move(facts)) {}

bool ClientRules::matchClientNameAndServiceID(const Dictionary& client, const String* clientName,
                                              const String* serviceID) {
  const Array names = pieces(client.string("client"));
  const Array services = pieces(client.string("service"));
  return matchExactStringWithList(&names, clientName, true) &&
         matchStringWithList(&services, serviceID, true);
}

bool ClientRules::isFrameworkEnabledForClient(const Dictionary& client) const {
  const String* enabledSince = client.string("enabledSince");
  if (enabledSince == nullptr) return true;
  return facts_.session->selfVersion >= versionParts(*enabledSince);
}

bool ClientRules::updatePostLink(Decision& decision, const Dictionary& client) const {
  bool taken = false;
  if (!decision.useDefaultPostURL || !decision.postURL) {
    decision.useDefaultPostURL = false;
    if (const String* url = client.string("post_url")) {
      decision.postURL = *url;
      taken = true;
      platform_.log.debug("HTTPSPostBackend(updatePostLink): Storebag '%s' for postURL", url->c_str());
    }
  }
  if (!decision.useDefaultRealtimePostURL || !decision.realtimePostURL) {
    decision.useDefaultRealtimePostURL = false;
    if (const String* url = client.string("realtime_post_url")) {
      decision.realtimePostURL = *url;
      platform_.log.debug("HTTPSPostBackend(updatePostLink): Storebag '%s' for realtimePostURL",
                          url->c_str());
    } else {
      decision.realtimePostURL = decision.postURL;
      platform_.log.debug("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '%s'",
                          shown(decision.postURL ? &*decision.postURL : nullptr).c_str());
    }
  }
  return taken;
}

void ClientRules::resetBackendStateWithClient(Decision& decision, const Dictionary* client) const {
  decision.eventThreshold = client != nullptr ? client->integer("event_threshold") : 0;
  platform_.log.debug("resetBackendStateWithClient: event_threshold set to %d", decision.eventThreshold);
  decision.extrasOnInternal = client != nullptr ? client->integer("extras_on_internal") : 0;
  platform_.log.debug("setBackendStateWithClient: extras on internal is set to %d",
                      decision.extrasOnInternal);
}

int32_t ClientRules::decide(Decision& decision, const Dictionary* userInfo, std::optional<uint32_t> owner) {
  decision.batchEvents.reset();
  decision.samplingThreshold.reset();
  decision.eventWhitelist.reset();
  decision.eventBlacklist.reset();
  rule_ = StateRule::none;
  if (!facts_.clients) return kBackendStateDisabled;
  Client client;
  if (userInfo != nullptr)
    client = {userInfo->string(kKYTReportingUserInfoClientName),
              userInfo->string(kKYTReportingUserInfoServiceName)};
  applyExpedite(decision, client);
  if (!facts_.session->requireUserInfo) return enableWithoutUserInfo(decision);
  if (!judged("user-information", userInfo != nullptr && !userInfo->empty(),
              userInfo != nullptr ? Value(*userInfo) : Value())) {
    rule_ = StateRule::userInformation;
    return kBackendStateUndecided;
  }
  const std::optional<String> known = platform_.deviceProperties.countryCode();
  const String* country = known ? &*known : nullptr;
  const Dictionary* entry = chosenEntry(client);
  if (entry == nullptr)
    tellWhyNot(Reason::clientNotListed, StateRule::client, client,
               "no entry of the storebag is for this client");
  if (entry == nullptr || !passesRules(decision, *entry, client, country)) return kBackendStateDisabled;
  const int32_t state = decideBySampling(decision, *entry, client, country);
  takeSettings(decision, *entry, client, state, owner);
  return state;
}

// Deliberately without the version gate: an entry that is too new for this version still says whether to
// batch.
void ClientRules::applyExpedite(Decision& decision, const Client& client) const {
  for (const Value& element : *facts_.clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr || !matchClientNameAndServiceID(*entry, client.name, client.service)) continue;
    if (entry->contains("expedite")) {
      decision.batchEvents = entry->integer("expedite") == 0;
      platform_.log.debug("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=%d",
                          *decision.batchEvents);
    }
    return;
  }
}

// No rule about consent, country, device, filters or sampling applies to a session without user information.
int32_t ClientRules::enableWithoutUserInfo(Decision& decision) const {
  const Dictionary* taken = nullptr;
  for (const Value& element : *facts_.clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr || !updatePostLink(decision, *entry)) continue;
    taken = entry;
    break;
  }
  resetBackendStateWithClient(decision, taken);
  judged("post-url", decision.postURL.has_value(), valueOf(decision.postURL ? &*decision.postURL : nullptr));
  return kBackendStateEnabled;
}

const Dictionary* ClientRules::chosenEntry(const Client& client) const {
  for (const Value& element : *facts_.clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr) continue;
    // Whoever is listed elsewhere is looked for in entry after entry: only the one that fits is worth telling.
    if (!matchClientNameAndServiceID(*entry, client.name, client.service)) continue;
    judged("client", true, valueOf(client.name), valueOf(entry->string("client")));
    judged("service", true, valueOf(client.service), valueOf(entry->string("service")));
    if (judged("version", isFrameworkEnabledForClient(*entry), facts_.session->versionText(),
               valueOf(entry->string("enabledSince"))))
      return entry;
  }
  judged("client", false, valueOf(client.name), *facts_.clients);
  return nullptr;
}

bool ClientRules::passesRules(Decision& decision, const Dictionary& entry, const Client& client,
                              const String* country) const {
  if (!passesConsent(decision, entry, client) || !passesLists(entry, client, country)) return false;
  const Array* filters = entry.array("filters");
  if (!judged("filters", filters != nullptr, valueOf(filters))) {
    platform_.log.error("HTTPSPostBackend(updateBackendState): filters are required.");
    rule_ = StateRule::filters;
    return false;
  }
  decision.filters.createFiltersFromArray(*filters);
  return true;
}

bool ClientRules::passesConsent(Decision& decision, const Dictionary& entry, const Client& client) const {
  const int32_t overrideDnu = entry.integer("override_dnu");
  judged("consent", overrideDnu == 1 || facts_.dnuEnabled, facts_.dnuEnabled,
         overrideDnu == 1 ? "overridden by override_dnu" : "required");
  if (overrideDnu == 1) {
    decision.dnuType = facts_.dnuEnabled ? 2 : 1;
    return true;
  }
  decision.dnuType = 0;
  if (facts_.dnuEnabled) return true;
  platform_.log.debug("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: %d.", overrideDnu);
  tellWhyNot(Reason::consentMissing, StateRule::consent, client, "the user has not given consent");
  return false;
}

bool ClientRules::passesLists(const Dictionary& entry, const Client& client, const String* country) const {
  Log& log = platform_.log;
  // The list is required, so it is matched by the rule that fails without one. By the same rule a device
  // whose country is not known passes: deliberate, servers count on hearing from those.
  const Array* locales = entry.array("locale_whitelist");
  if (!judged("country", matchStringWithList(locales, country, false), valueOf(country), valueOf(locales))) {
    if (log.debugEnabled())
      log.debug("HTTPSPostBackend(updateBackendState): (%s) isn't in country code list %s",
                shown(country).c_str(), shown(locales).c_str());
    tellWhyNot(Reason::countryNotListed, StateRule::country, client,
               "the storebag's entry does not list this country");
    return false;
  }
  const String* family = facts_.session->productFamily ? &*facts_.session->productFamily : nullptr;
  const Array* devices = entry.array("device_whitelist");
  if (!judged("device", matchStringWithList(devices, family, true), valueOf(family), valueOf(devices))) {
    if (log.debugEnabled())
      log.debug("HTTPSPostBackend(updateBackendState): (%s) isn't in device whitelist %s",
                shown(family).c_str(), shown(devices).c_str());
    tellWhyNot(Reason::deviceNotListed, StateRule::device, client,
               "the storebag's entry does not list this device");
    return false;
  }
  const String* hardware = facts_.session->hardwareType ? &*facts_.session->hardwareType : nullptr;
  const Array* excluded = entry.array("device_blacklist");
  if (!judged("device-excluded", !matchStringWithList(excluded, hardware, false), valueOf(hardware),
              valueOf(excluded))) {
    if (log.debugEnabled())
      log.debug("HTTPSPostBackend(updateBackendState): (%s) is in device blacklist %s",
                shown(hardware).c_str(), shown(excluded).c_str());
    tellWhyNot(Reason::deviceNotListed, StateRule::device, client,
               "the storebag's entry excludes this device");
    return false;
  }
  return true;
}

int32_t ClientRules::decideBySampling(Decision& decision, const Dictionary& entry, const Client& client,
                                      const String* country) const {
  const Value* global = entry.find("sampling_threshold");
  Value threshold = global != nullptr ? *global : Value();
  if (const Dictionary* forCountry = countrySampling(entry, country)) {
    const Value* replacement = forCountry->find("threshold");
    Value changed = replacement != nullptr ? *replacement : Value();
    platform_.log.debug(
        "HTTPSPostBackend(updateBackendState): sampling threshold for %s changed from %.02f to %.02f",
        country->c_str(), asShown(threshold), asShown(changed));
    threshold = std::move(changed);
  }
  decision.samplingThreshold = threshold;
  judged("sampling", !threshold.isNull() && facts_.samplingFactor <= threshold.doubleValue(),
         facts_.samplingFactor, threshold);
  if (threshold.isNull()) {
    tellWhyNot(Reason::samplingThresholdMissing, StateRule::threshold, client,
               "the storebag's entry has no sampling_threshold");
    return kBackendStateDisabled;
  }
  if (facts_.samplingFactor <= threshold.doubleValue()) return kBackendStateEnabled;
  tellWhyNot(Reason::sampledOut, StateRule::sampling, client, "this session was not drawn");
  const Value* second = entry.find("override_sampling");
  decision.overrideSampling = second != nullptr ? *second : Value();
  // "Greater than" and no other test: an override that is not a number holds the back end.
  const bool isOver =
      !decision.overrideSampling.isNull() && facts_.samplingFactor > decision.overrideSampling.doubleValue();
  judged("override-sampling", !isOver, facts_.samplingFactor, decision.overrideSampling);
  return isOver ? kBackendStateDisabled : kBackendStateHeld;
}

void ClientRules::takeSettings(Decision& decision, const Dictionary& entry, const Client& client,
                               int32_t state, std::optional<uint32_t> owner) {
  Log& log = platform_.log;
  resetBackendStateWithClient(decision, &entry);
  if (entry.contains("custom_clientId"))
    decision.uuidCustom = getPersistentIdentifierForCustomClientIDSuffix(client, owner);
  if (log.debugEnabled())
    log.debug("HTTPSPostBackend(updateBackendState): %s: client found %s:%s, state=%d, samplingFactor=%f",
              facts_.name.c_str(), shown(client.name).c_str(), shown(client.service).c_str(), state,
              facts_.samplingFactor);
  updatePostLink(decision, entry);
  judged("post-url", decision.postURL.has_value(), valueOf(decision.postURL ? &*decision.postURL : nullptr));
  if (const Array* list = entry.array("event_whitelist")) {
    decision.eventWhitelist = *list;
    log.debugObjects("HTTPSPostBackend(updateBackendState): %s: eventWhitelist=%@",
                     {Value(facts_.name), Value(*list)});
  }
  if (const Array* list = entry.array("event_blacklist")) {
    decision.eventBlacklist = *list;
    log.debugObjects("HTTPSPostBackend(updateBackendState): %s: eventBlacklist=%@",
                     {Value(facts_.name), Value(*list)});
  }
  decision.shouldUseWiFiOnly = entry.integer("use_wifi_only") != 0;
}

// Each decision's own line is at the debug level; whoever runs the device sees one a minute without it.
void ClientRules::tellWhyNot(Reason reason, StateRule rule, const Client& client, const char* why) const {
  rule_ = rule;
  if (!platform_.counters.addAndMayLog(reason, platform_.clock.monotonic())) return;
  platform_.log.normal("HTTPSPostBackend(updateBackendState): %s posts nothing of %s:%s, since %s",
                       facts_.name.c_str(), shown(client.name).c_str(), shown(client.service).c_str(), why);
}

String ClientRules::getPersistentIdentifierForCustomClientIDSuffix(const Client& client,
                                                                   std::optional<uint32_t> owner) {
  const String empty;
  const std::string key =
      formatObjects("%@:%@:%@", {Value("uuid"), Value(client.name != nullptr ? *client.name : empty),
                                 Value(client.service != nullptr ? *client.service : empty)});
  const auto known = std::find_if(madeIdentifiers_.begin(), madeIdentifiers_.end(),
                                  [&](const auto& made) { return made.first == key; });
  String identifier =
      persistentIdentifier(platform_, owner, key, known != madeIdentifiers_.end() ? &known->second : nullptr);
  if (known == madeIdentifiers_.end()) {
    if (madeIdentifiers_.size() >= kMostMadeIdentifiers) madeIdentifiers_.erase(madeIdentifiers_.begin());
    madeIdentifiers_.emplace_back(key, identifier);
  }
  platform_.log.normal("getPersistentIdentifierForCustomClientIDSuffix: The value for %s: %s", key.c_str(),
                       platform_.log.shownIdentifier(identifier).c_str());
  return identifier;
}

}  // namespace kyt
