#include "config/StorebagFetcher.h"

#include <algorithm>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "config/ClientTypes.h"
#include "config/Environment.h"
#include "platform/Bundle.h"
#include "platform/Platform.h"
#include "platform/PropertyLists.h"
#include "platform/base/Departures.h"
#include "platform/objects/Base64.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr char kFallbackStorebagName[] = "cadmor";

// What sessions of the family "cadmor" get while their server cannot be reached. Built in, so never verified.
constexpr int kFallbackRefreshCycle = 3600;  // seconds

Dictionary fallbackStorebag() {
  const Dictionary section{{"qdx", Dictionary{{"active", true}}}};
  return Dictionary{{"vantu_internal", section},
                    {"development", section},
                    {"release", section},
                    {"version", "1.0.0-Cadmor-Fallback"},
                    {"refresh_cycle", kFallbackRefreshCycle}};
}

const Dictionary* sectionEntry(const Dictionary& bag, const std::optional<String>& name) {
  return name ? bag.dictionary(*name) : nullptr;
}

std::optional<Data> decodedEntry(const Dictionary& dictionary, const char* key, Log& log) {
  const String* text = dictionary.string(key);
  std::optional<Data> bytes;
  if (text == nullptr)
    log.normal("fetchStorebagWithName: The storebag's \"%s\" is missing or no text", key);
  else if (bytes = base64Decode(*text); !bytes)
    log.normal("fetchStorebagWithName: The storebag's \"%s\" is no base64", key);
  return bytes;
}

// The dictionary that the signed bytes are; none with its reason in the log.
std::optional<Dictionary> signedContents(const Data& bag, PropertyLists& propertyLists, Log& log) {
  const std::variant<Value, Error> content = propertyLists.parse(bag.view());
  if (const Error* error = std::get_if<Error>(&content)) {
    log.normal("fetchStorebagWithName: What the storebag's signature covers is no property list: %s",
               error->localizedDescription.c_str());
    return std::nullopt;
  }
  const Dictionary* dictionary = std::get<Value>(content).dictionary();
  if (dictionary == nullptr) {
    log.normal("fetchStorebagWithName: What the storebag's signature covers is no dictionary");
    return std::nullopt;
  }
  return *dictionary;
}

std::string toldRefusal(const std::string& why, Log& log) {
  log.normal("fetchStorebagWithName: The storebag is refused: %s", why.c_str());
  return "the storebag is refused: " + why;
}

}  // namespace

int32_t maxAgeFromCacheControl(std::optional<std::string_view> header) {
  if (!header) return kMaxStorebagAge;
  bool found = false;
  size_t begin = 0;
  while (begin <= header->size()) {
    const size_t end = std::min(header->find_first_of("= ", begin), header->size());
    const std::string_view piece = header->substr(begin, end - begin);
    if (found) return Value(piece).intValue();
    found = piece == "max-age";
    begin = end + 1;
  }
  return kMaxStorebagAge;
}

StorebagFetcher::StorebagFetcher(Configuration configuration, Mutex& backendClassLock,
                                 StorebagRefusals refusals)
    : configuration_(configuration),
      backendClassLock_(backendClassLock),
      guard_(configuration.platform, refusals) {}

URLRequest StorebagFetcher::storebagRequest(const std::optional<String>& name,
                                            const std::optional<String>& lastModified) const {
  Log& log = configuration_.platform.log;
  const String version = configuration_.platform.clientBundle.version().value_or("8.0");
  URLRequest request;
  request.url = formatObjects("%@/%@?version=%@", {configuration_.environment.storebagServerURL(),
                                                   name ? Value(*name) : Value(), version});
  request.timeout = kStorebagRequestTimeout;
  request.maxRedirects = kMaxStorebagRedirects;
  log.debug("fetchStorebagWithName: Storebag Server URL: %s", request.url.c_str());
  if (lastModified) {
    log.debug("fetchStorebagWithName: Adding 'Last-Modified: %s' to the header", lastModified->c_str());
    request.headers.emplace_back("If-Modified-Since", lastModified->str());
  }
  return request;
}

StorebagFetcher::Fetch<Dictionary> StorebagFetcher::fetchStorebagWithName(
    const std::optional<String>& name, const std::optional<String>& lastModified) {
  Log& log = configuration_.platform.log;
  Fetch<Dictionary> fetch;
  fetch.lastModified = lastModified;
  URLRequest request = storebagRequest(name, lastModified);
  fetch.address = withoutPassword(request.url);
  const URLReply reply = startAndWait(std::move(request), [this](URLRequest sent, URLCompletion completion) {
    urlSession().start(std::move(sent), std::move(completion));
  });
  if (reply.error || !reply.response) {
    log.normal(
        "fetchStorebagWithName: Error resolving with lookup server %s, sendSynchronousRequest error %s",
        fetch.address.c_str(), reply.error ? reply.error->localizedDescription.c_str() : "(null)");
    fetch.problem = reply.error ? reply.error->localizedDescription : "no answer";
    if (!name || *name != kFallbackStorebagName) return fetch;
    log.normal("fetchStorebagWithName: Loading default storebag '%s'", name->c_str());
    log.normal(
        "fetchStorebagWithName: For %d seconds it replaces the last good one: client types 7, 11, 13 and 20 post nothing",
        kFallbackRefreshCycle);
    fetch.result = fallbackStorebag();
    return fetch;
  }

  fetch.maxAge = maxAgeFromCacheControl(reply.response->header("Cache-Control"));
  if (const std::optional<std::string> modified = reply.response->header("Last-Modified")) {
    if (lastModified && (!reply.data || reply.data->empty())) {
      log.debug("fetchStorebagWithName: storebag content has not changed. using its cached version");
      if (const auto why = name ? guard_.refusalOfTheLast(*name) : std::nullopt)
        fetch.problem = toldRefusal(*why, log);
      else
        fetch.result = NotModified();
      return fetch;
    }
    fetch.lastModified = String(*modified);
    log.debug("fetchStorebagWithName: New 'Last-Modified: %s' received", fetch.lastModified->c_str());
  }
  // The status decides nothing, but an error page is no storebag, and then it is the reason that helps.
  const int status = reply.response->status;
  if (std::optional<Dictionary> bag = verifiedBag(reply, fetch.problem)) {
    if (const std::optional<std::string> why = refusal(name, reply, *bag)) {
      fetch.problem = toldRefusal(*why, log);
      fetch.lastModified = lastModified;
    } else {
      fetch.result = std::move(*bag);
    }
  } else if (status < 200 || status > 299) {
    log.normal("fetchStorebagWithName: %s answered with status %d", fetch.address.c_str(), status);
    fetch.problem = "status " + std::to_string(status);
  }
  return fetch;
}

std::vector<std::unique_ptr<PublicKey>> StorebagFetcher::publicKeys() const {
  const Platform& platform = configuration_.platform;
  std::vector<std::unique_ptr<PublicKey>> keys;
  bool isThere = false;
  for (const char* name : {"publicKey", "publicKey2"}) {
    const std::optional<Data> der = platform.clientBundle.resource(name, "der");
    if (!der) continue;
    isThere = true;
    if (auto key = platform.cryptography.publicKeyFromDER(der->bytes()))
      keys.push_back(std::move(key));
    else if (der->view().starts_with("-----BEGIN"))
      platform.log.normal("fetchStorebagWithName: The bundle's %s.der is PEM, not DER", name);
    else
      platform.log.normal("fetchStorebagWithName: The bundle's %s.der is no RSA public key in DER", name);
  }
  if (!isThere)
    platform.log.normal("fetchStorebagWithName: The bundle has no publicKey.der that could be read");
  return keys;
}

bool StorebagFetcher::verifies(const Data& bag, const Data& signature) const {
  const std::vector<std::unique_ptr<PublicKey>> keys = publicKeys();
  if (keys.empty()) return false;
  const auto digest = configuration_.platform.cryptography.sha1(bag.bytes());
  for (const auto& key : keys)
    if (key->verifySHA1(digest, signature.bytes())) return true;
  configuration_.platform.log.error("fetchStorebagWithName: Signature can not be verified, %p",
                                    static_cast<const void*>(keys.front().get()));
  return false;
}

bool StorebagFetcher::verifiesSHA256(const URLReply& reply) const {
  Cryptography& cryptography = configuration_.platform.cryptography;
  const auto document = configuration_.platform.propertyLists.parse(reply.data->view());
  const Value* root = std::get_if<Value>(&document);
  const Dictionary* dictionary = root != nullptr ? root->dictionary() : nullptr;
  const String* text = dictionary != nullptr ? dictionary->string(kStorebagSignature256) : nullptr;
  const std::optional<Data> signature = text != nullptr ? base64Decode(*text) : std::nullopt;
  if (!signature) return false;
  const auto digest = cryptography.sha256(base64Decode(*dictionary->string("bag"))->bytes());
  for (const auto& key : publicKeys())
    if (key->verifySHA256(digest, signature->bytes())) return true;
  return false;
}

std::optional<std::string> StorebagFetcher::refusal(const std::optional<String>& name, const URLReply& reply,
                                                    const Dictionary& bag) {
  if (guard_.requiresSHA256() && !verifiesSHA256(reply)) {
    std::string text = "it has no \"";
    return text.append(kStorebagSignature256).append("\" that verifies");
  }
  return name ? guard_.refusal(*name, bag) : std::nullopt;
}

std::optional<Dictionary> StorebagFetcher::verifiedBag(const URLReply& reply, std::string& problem) {
  Log& log = configuration_.platform.log;
  PropertyLists& propertyLists = configuration_.platform.propertyLists;
  std::variant<Value, Error> document =
      propertyLists.parse(reply.data ? reply.data->view() : std::string_view());
  if (const Error* error = std::get_if<Error>(&document))
    log.error("fetchStorebagWithName: propertyListWithData error %s", error->localizedDescription.c_str());
  const Value* root = std::get_if<Value>(&document);
  const Dictionary* dictionary = root != nullptr ? root->dictionary() : nullptr;
  if (dictionary == nullptr || dictionary->string("signature") == nullptr) {
    log.error("fetchStorebagWithName: Signature is missing");
    problem = "the reply is no signed storebag";
    return std::nullopt;
  }

  const std::optional<Data> signature = decodedEntry(*dictionary, "signature", log);
  const std::optional<Data> bag = decodedEntry(*dictionary, "bag", log);
  if (!signature || !bag || !verifies(*bag, *signature)) {
    problem = "the signature cannot be verified";
    return std::nullopt;
  }
  std::optional<Dictionary> contents = signedContents(*bag, propertyLists, log);
  if (!contents) problem = "what the signature covers is no dictionary";
  return contents;
}

StorebagFetcher::Fetch<StorebagFetcher::Section> StorebagFetcher::fetchStorebagForEnvironmentAndClientType(
    int32_t clientType, const std::optional<String>& lastModified) {
  Log& log = configuration_.platform.log;
  Fetch<Section> fetch;
  fetch.lastModified = lastModified;
  if (clientType == 0) {
    log.error("fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type %d",
              clientType);
    return fetch;
  }
  const std::optional<String> name = storebagNameForClientType(clientType);
  Fetch<Dictionary> whole = fetchStorebagWithName(name, lastModified);
  fetch.maxAge = whole.maxAge;
  fetch.lastModified = std::move(whole.lastModified);
  fetch.address = std::move(whole.address);
  fetch.problem = std::move(whole.problem);
  if (std::holds_alternative<NotModified>(whole.result)) {
    fetch.result = NotModified();
    return fetch;
  }
  const Dictionary* bag = std::get_if<Dictionary>(&whole.result);
  if (bag == nullptr) {
    log.error("fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type %d",
              clientType);
    return fetch;
  }
  const Dictionary* section = sectionInForce(*bag, clientType);
  if (section == nullptr) {
    fetch.problem = "the storebag has no section for the environment in force";
    return fetch;
  }

  // A bag that does not say its version cannot be told from another one, so it counts as a failed fetch.
  const String* version = bag->string("version");
  if (version == nullptr) {
    log.normal(
        "fetchStorebagForEnvironmentAndClientType: The storebag for client type %d has no text \"version\"",
        clientType);
    fetch.problem = "the storebag has no text \"version\"";
    return fetch;
  }
  if (const Value* refreshCycle = bag->find("refresh_cycle")) {
    fetch.maxAge = std::min(refreshCycle->intValue(), kMaxStorebagAge);
    log.normal("fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=%d", fetch.maxAge);
  }
  // The built-in one, which comes with a problem, is none that a server could play back.
  if (name && fetch.problem.empty()) guard_.taken(*name, *bag);
  fetch.result = Section{*section, *version};
  return fetch;
}

const Dictionary* StorebagFetcher::sectionInForce(const Dictionary& bag, int32_t clientType) const {
  Log& log = configuration_.platform.log;
  const uint32_t environment = configuration_.environment.userDefaultsEnvironment();
  const std::optional<String> name = environmentName(environment);
  const Dictionary* section = sectionEntry(bag, name);
  if (section == nullptr && environment == kEnvironmentSeed) {
    log.error("fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.");
    section = sectionEntry(bag, environmentName(kEnvironmentRelease));
  }
  if (section == nullptr) {
    log.error(
        "fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type %d with %s environment",
        clientType, name ? name->c_str() : "(null)");
  }
  return section;
}

URLSession& StorebagFetcher::urlSession() {
  MutexLock lock(backendClassLock_);
  if (urlSession_ == nullptr) {
    URLSessionConfiguration configuration;
    configuration.sourceApplication = kSourceApplication;
    urlSession_ = configuration_.platform.urlSessions.create(std::move(configuration));
  }
  return *urlSession_;
}

}  // namespace kyt
