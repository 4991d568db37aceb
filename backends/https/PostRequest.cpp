#include "backends/https/PostRequest.h"

#include <cmath>
#include <span>
#include <vector>

#include "backend/PayloadCompression.h"
#include "backend/Text.h"
#include "config/ClientTypes.h"
#include "config/DeviceIdentity.h"
#include "config/Environment.h"
#include "platform/Cryptography.h"
#include "platform/JSON.h"
#include "platform/Platform.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Hex.h"
#include "platform/base/JSONLayout.h"
#include "platform/base/UserBudget.h"
#include "platform/objects/Description.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr int32_t kDigestAlgorithmHMACSHA1 = 0;
constexpr size_t kDigestGroup = 4;  // bytes between blanks

double finiteOrMinusOne(double seconds) {
  return std::isfinite(seconds) ? seconds : -1.0;
}

bool isPostable(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::boolean:
    case Value::Kind::integer:
    case Value::Kind::unsignedInteger:
    case Value::Kind::string:
      return true;
    case Value::Kind::real:
      return std::isfinite(*value.real());
    default:
      return false;
  }
}

// What laying out adds to a dictionary's entry at that depth: a line break, the indentation, the blank behind the colon.
constexpr size_t roomOfEntries(size_t depth) {
  return 1 + 4 * depth + 1;
}

// To the list of records, whose values are no containers: what is between its brackets and the texts in it.
size_t roomOfTheLayout(const Array& records) {
  constexpr size_t kLineOfRecord = 1 + 4 * 2, kLineOfListsEnd = 1 + 4;
  size_t room = records.empty() ? 0 : kLineOfListsEnd;
  for (const Value& record : records) {
    const size_t entries = record.dictionary()->size();
    room += kLineOfRecord + entries * roomOfEntries(3) + (entries != 0 ? kLineOfRecord : 0);
  }
  return room;
}

}  // namespace

PostRequest::PostRequest(const Configuration& configuration, PostFacts facts)
    : configuration_(configuration), facts_(std::move(facts)) {}

// Dates become seconds since 1970. What JSON cannot carry goes.
void PostRequest::removeUnpostable(Dictionary& record) const {
  bool allPostable = true;
  for (const DictionaryEntry& entry : record) allPostable = allPostable && isPostable(entry.value);
  if (allPostable) return;
  record.removeIf([this](const String& key, Value& value) {
    if (const std::optional<Date> date = value.date())
      value = Value(finiteOrMinusOne(date->secondsSince1970));
    if (isPostable(value)) return false;
    configuration_.platform.counters.add(Reason::valueNotPostable);
    configuration_.platform.log.error(
        "HTTPSPostBackend(createMessageForPostAndLogging): JSONWriter unable to handle key: %s, value: %s",
        key.c_str(), description(value).c_str());
    return true;
  });
}

bool PostRequest::mayBeShown() const {
  // Asked in any case: it says in the log what it finds.
  const uint32_t environment = configuration_.environment.userDefaultsEnvironment();
  const bool inSuchAnEnvironment =
      environment == kEnvironmentDevelopment || environment == kEnvironmentInternal;
  return (facts_.settingShowsText && inSuchAnEnvironment) || facts_.consentShowsText;
}

PostRequest::Message PostRequest::message(Array records) const {
  Platform& platform = configuration_.platform;
  Value* values = records.mutableBegin();
  for (size_t i = 0; i < records.size(); ++i) removeUnpostable(*values[i].mutableDictionary());
  Message made;
  made.prettySize = roomOfTheLayout(records);
  Dictionary entries;
  entries.reserve(3);
  entries.append("postTime", finiteOrMinusOne(platform.clock.timeOfDay().asSeconds()));
  // Deliberately a list that ends at the first missing object: servers know that events never come without
  // a client ID, and that such a message carries its time alone.
  if (facts_.clientID) {
    made.events = records.size();
    entries.append("clientId", *facts_.clientID);
    entries.append("events", Value(std::move(records)));
  } else {
    made.prettySize = 0;
  }
  made.prettySize += entries.size() * roomOfEntries(1) + 1;
  const Value message(std::move(entries));
  made.json.reserve(facts_.sizeHint + facts_.sizeHint / 8);
  platform.json.writeCompact(message, made.json);
  made.prettySize += made.json.size();
  return made;
}

Value PostRequest::prettyText(std::string_view json) {
  std::string pretty;
  appendLaidOutJSON(pretty, json);
  return Value(pretty);
}

// On any but an internal build events go over https alone.
std::string PostRequest::addressWithForcedScheme(const String& url) const {
  if (configuration_.deviceIdentity.isInternalBuild()) return url.str();
  const std::vector<std::string_view> pieces = splitText(url, "://");
  if (pieces.size() < 2 || equalsIgnoringCase(pieces[0], "https")) return url.str();
  // Any further piece is dropped, on purpose kept this simple.
  std::string address("https");
  return address.append("://").append(pieces[1]);
}

std::string PostRequest::digestOfBody(const Data& body) const {
  const auto digest = configuration_.platform.cryptography.hmacSHA1(facts_.digestKey->bytes(), body.bytes());
  std::string text = "<";
  for (size_t i = 0; i < digest.size(); i += kDigestGroup) {
    if (i != 0) text += ' ';
    appendHex(std::span(digest).subspan(i, kDigestGroup), text);
  }
  return text += '>';
}

URLRequest PostRequest::request(const String& url, std::string json,
                                const std::optional<EventMap>& eventMap) const {
  const SessionFacts& session = *facts_.session;
  std::optional<Data> body = gzipDeflate(configuration_.platform, std::as_bytes(std::span(json)));
  const bool compressed = body && !body->empty() && body->size() < json.size();
  if (!compressed) body = Data(std::string_view(json));

  URLRequest request;
  request.method = "POST";
  request.url = addressWithForcedScheme(url);
  auto header = [&request](const char* name, std::string value) {
    request.headers.emplace_back(name, std::move(value));
  };
  if (facts_.clientName) header("X-KYT-Client-Name", facts_.clientName->str());
  if (facts_.serviceName) header("X-KYT-Service-Name", facts_.serviceName->str());
  if (session.isInternal) header("X-KYT-Internal-Build", "1");
  header("User-Agent", formatObjects("KYTReporting/%d.%d%@ (%@; %@)",
                                     {unsigned{session.selfVersion[0]}, unsigned{session.selfVersion[1]},
                                      session.versionSuffix(),
                                      session.hardwareType ? Value(*session.hardwareType) : Value(),
                                      session.productVersion ? Value(*session.productVersion) : Value()}));
  header("X-KYT-Client-Version", std::to_string(session.clientVersion));
  header("X-KYT-Sender", clientTypeShortCode(session.compType));
  if (eventMap)
    header("X-KYT-Event-Map",
           formatObjects("%@ %@", {unsigned{eventMap->method}, unsigned{eventMap->responseCode}}));
  header("Accept", "application/json");
  header("Content-Type", "application/json");
  header("Content-Length", std::to_string(body->size()));
  if (compressed) header("Content-Encoding", "gzip");
  if (facts_.digestKey && facts_.digestAlgorithm == kDigestAlgorithmHMACSHA1)
    header("X-KYT-DIGEST", digestOfBody(*body));
  request.body = std::move(*body);
  request.allowsCellularAccess = !facts_.shouldUseWiFiOnly;
  request.account = facts_.account;
  request.isByConsent = facts_.consentShowsText;  // the same condition
  if (facts_.clientID) request.identity = facts_.clientID->str();
  return request;
}

}  // namespace kyt
