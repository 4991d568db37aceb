// The message, its request, and what a reply means.
#include <cmath>

#include "backend/PayloadCompression.h"
#include "backend/Text.h"
#include "backends/https/HTTPSPostBackend.h"
#include "config/ClientTypes.h"
#include "config/DeviceIdentity.h"
#include "config/Environment.h"
#include "platform/Cryptography.h"
#include "platform/JSON.h"
#include "platform/Platform.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/UserBudget.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
#include "platform/queues/LineLimits.h"
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

// What a reply needs: it may come when its back end is gone.
struct Reply {
  std::weak_ptr<KYTReportingBackend> backend;
  Platform& platform;
  String name;
  FlushCompletion completion;
  size_t events;
  std::string address;  // without what a "?" begins
  std::shared_ptr<UserAccount> account;

  void operator()(std::optional<Data>, std::optional<URLResponse> response, std::optional<Error> error) {
    const ClientScope scope(account ? std::optional(account->user()) : std::nullopt);
    const int status = response ? response->status : 0;
    const bool redirected = status >= 300 && status <= 399;
    const bool refused = status >= 400 && status <= 599;  // also by a reply that broke off
    if (error) {
      if (!redirected && !refused) count(Reason::requestFailed, Reason::postFailed);
      platform.log.error("HTTPSPostBackend(postJsonMessage): post error: %s",
                         error->localizedDescription.c_str());
    }
    if (redirected) tell(status, Reason::requestRedirected, Reason::postRedirected);
    if (refused) tell(status, Reason::requestRefused, Reason::postRefused);
    if (status >= 500 && status <= 599) error = disable(status);
    if (completion) completion(Value(), std::move(error));
  }

  void count(Reason request, Reason lost) {
    platform.counters.add(request);
    platform.counters.add(lost, events);
  }
  // What switches the back end off has a line of its own.
  void tell(int status, Reason request, Reason lost) {
    platform.counters.add(request);
    const bool mayLog = platform.counters.addAndMayLog(lost, platform.clock.monotonic(), events);
    if (mayLog && status < 500)
      platform.log.normal("postJSONMessage: %s answered with status %d, %zu events of backend %s are lost",
                          address.c_str(), status, events, name.c_str());
  }

  Error disable(int status) {
    char text[256];
    std::snprintf(text, sizeof text, "backend %s disabled by server %d return code", name.c_str(), status);
    platform.log.normal("postJSONMessage: %s", text);
    if (const auto alive = backend.lock()) alive->setState(kBackendStateDisabled);
    return Error{kKYTReportingErrorDomain, status, text};
  }
};

}  // namespace

// Dates become seconds since 1970. What JSON cannot carry goes.
void HTTPSPostBackend::removeUnpostable(Dictionary& record) const {
  bool allPostable = true;
  for (const DictionaryEntry& entry : record) allPostable = allPostable && isPostable(entry.value);
  if (allPostable) return;
  record.removeIf([this](const String& key, Value& value) {
    if (const std::optional<Date> date = value.date())
      value = Value(finiteOrMinusOne(date->secondsSince1970));
    if (isPostable(value)) return false;
    platform().counters.add(Reason::valueNotPostable);
    platform().log.error(
        "HTTPSPostBackend(createMessageForPostAndLogging): JSONWriter unable to handle key: %s, value: %s",
        key.c_str(), description(value).c_str());
    return true;
  });
}

std::optional<String> HTTPSPostBackend::clientID() const {
  if (extrasOnInternal_ != 0 && facts().isInternal) return facts().udid;
  if (uuidCustom_) return uuidCustom_;
  return dnuType_ != 0 ? uuidOverrideDnu_ : uuidRespectDnu_;
}

bool HTTPSPostBackend::mayShowPrettyText() const {
  const uint32_t environment = configuration_.environment.userDefaultsEnvironment();
  const bool forced =
      forceEventLogging_ && (environment == kEnvironmentDevelopment || environment == kEnvironmentInternal);
  return forced || (dnuType_ == 0 && dnuEnabled_);
}

std::optional<std::string> HTTPSPostBackend::createMessageForPostAndLogging(Array records,
                                                                            Value* prettyJSONString,
                                                                            size_t* events) {
  Value* values = records.mutableBegin();
  for (size_t i = 0; i < records.size(); ++i) removeUnpostable(*values[i].mutableDictionary());
  Dictionary entries;
  entries.reserve(3);
  entries.append("postTime", finiteOrMinusOne(platform().clock.timeOfDay().asSeconds()));
  // Deliberately a list that ends at the first missing object: servers know that events never come without
  // a client ID, and that such a message carries its time alone.
  const std::optional<String> client = clientID();
  if (events != nullptr) *events = client ? records.size() : 0;
  if (client) {
    entries.append("clientId", *client);
    entries.append("events", Value(std::move(records)));
  } else {
    platform().counters.add(Reason::postWithoutClientID, records.size());
  }
  const Value message(std::move(entries));
  std::string json;
  json.reserve(jsonSizeHint_ + jsonSizeHint_ / 8);
  platform().json.writeCompact(message, json);
  jsonSizeHint_ = json.size();
  if (prettyJSONString != nullptr && mayShowPrettyText()) {
    std::string pretty;
    platform().json.writePretty(message, pretty);
    *prettyJSONString = Value(pretty);
  }
  return json;
}

// On any but an internal build events go over https alone.
std::string HTTPSPostBackend::addressWithForcedScheme(const String& url) const {
  if (configuration_.deviceIdentity.isInternalBuild()) return url.str();
  const std::vector<std::string_view> pieces = splitText(url, "://");
  if (pieces.size() < 2 || equalsIgnoringCase(pieces[0], "https")) return url.str();
  // Any further piece is dropped, on purpose kept this simple.
  std::string address("https");
  return address.append("://").append(pieces[1]);
}

std::string HTTPSPostBackend::digestOfBody(const Data& body) const {
  const auto digest = platform().cryptography.hmacSHA1(digestKey()->bytes(), body.bytes());
  std::string text = "<";
  for (size_t i = 0; i < digest.size(); i += kDigestGroup) {
    if (i != 0) text += ' ';
    appendHex(std::span(digest).subspan(i, kDigestGroup), text);
  }
  return text += '>';
}

URLRequest HTTPSPostBackend::newRequest(std::string url, std::string json, std::optional<uint16_t> method,
                                        std::optional<uint16_t> responseCode) const {
  std::optional<Data> body = gzipDeflate(platform(), std::as_bytes(std::span(json)));
  const bool compressed = body && !body->empty() && body->size() < json.size();
  if (!compressed) body = Data(std::string_view(json));

  URLRequest request;
  request.method = "POST";
  request.url = std::move(url);
  auto header = [&request](const char* name, std::string value) {
    request.headers.emplace_back(name, std::move(value));
  };
  if (const String* name = userInfoText(kKYTReportingUserInfoClientName))
    header("X-KYT-Client-Name", name->str());
  if (const String* name = userInfoText(kKYTReportingUserInfoServiceName))
    header("X-KYT-Service-Name", name->str());
  if (facts().isInternal) header("X-KYT-Internal-Build", "1");
  header("User-Agent",
         formatObjects("KYTReporting/%d.%d%@ (%@; %@)",
                       {unsigned{facts().selfVersion[0]}, unsigned{facts().selfVersion[1]}, versionSuffix(),
                        facts().hardwareType ? Value(*facts().hardwareType) : Value(),
                        facts().productVersion ? Value(*facts().productVersion) : Value()}));
  header("X-KYT-Client-Version", std::to_string(facts().clientVersion));
  header("X-KYT-Sender", clientTypeShortCode(facts().compType));
  if (method && responseCode)
    header("X-KYT-Event-Map", formatObjects("%@ %@", {unsigned{*method}, unsigned{*responseCode}}));
  header("Accept", "application/json");
  header("Content-Type", "application/json");
  header("Content-Length", std::to_string(body->size()));
  if (compressed) header("Content-Encoding", "gzip");
  if (digestKey() && digestAlgorithm() == kDigestAlgorithmHMACSHA1)
    header("X-KYT-DIGEST", digestOfBody(*body));
  request.body = std::move(*body);
  request.allowsCellularAccess = !shouldUseWiFiOnly_;
  request.account = userAccount();
  return request;
}

void HTTPSPostBackend::postJSONMessage(std::string json, MessageFlag flag, std::optional<uint16_t> method,
                                       std::optional<uint16_t> responseCode, FlushCompletion completion,
                                       size_t events) {
  const std::optional<String>& url = isRealtime(flag) ? realtimePostURL_ : postURL_;
  if (!url) {
    platform().counters.add(Reason::postWithoutURL, events);
    if (platform().counters.mayTell(Reason::postWithoutURL, name().str() + std::to_string(facts().compType),
                                    platform().clock.monotonic()))
      platform().log.normal(
          "HTTPSPostBackend(postJsonMessage): The storebag's %s has no post_url for client type %d: %zu events are lost",
          name().c_str(), facts().compType, events);
    if (completion) completion(Value(), Error{kKYTReportingErrorDomain, -1, "postURL is nil"});
    return;
  }
  URLRequest request = newRequest(addressWithForcedScheme(*url), std::move(json), method, responseCode);
  const auto delegate = connectivityDelegate();
  // The poster went away with its session: nothing is sent, and the completion is deliberately never called.
  if (delegate == nullptr) {
    platform().counters.add(Reason::postWithoutPoster, events);
    return;
  }
  std::string address = request.url.substr(0, request.url.find('?'));
  delegate->postURLRequestWithCompletionHandler(
      std::move(request), Reply{weak_from_this(), platform(), name(), std::move(completion), events,
                                std::move(address), userAccount()});
}

}  // namespace kyt
