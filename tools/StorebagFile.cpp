#include "tools/StorebagFile.h"

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <memory>

#include "platform/Cryptography.h"
#include "platform/JSON.h"
#include "platform/PropertyLists.h"
#include "platform/objects/Base64.h"
#include "tools/TomlValues.h"

namespace kyt::tools {

namespace {

constexpr char kDomain[] = "KYTToolsErrorDomain";

Error failure(std::string text) {
  return Error{kDomain, -1, std::move(text)};
}

template <typename T, void (*Free)(T*)>
struct Freer {
  void operator()(T* object) const { Free(object); }
};
void freeBIO(BIO* bio) {
  BIO_free_all(bio);
}
using KeyPointer = std::unique_ptr<EVP_PKEY, Freer<EVP_PKEY, EVP_PKEY_free>>;
using BIOPointer = std::unique_ptr<BIO, Freer<BIO, freeBIO>>;
using DigestPointer = std::unique_ptr<EVP_MD_CTX, Freer<EVP_MD_CTX, EVP_MD_CTX_free>>;

std::string contents(BIO* bio) {
  char* bytes = nullptr;
  const long length = BIO_get_mem_data(bio, &bytes);
  return length > 0 ? std::string(bytes, static_cast<size_t>(length)) : std::string();
}

KeyPointer privateKey(std::string_view pem) {
  BIOPointer bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  KeyPointer key(PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr));
  if (key && EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA) key.reset();
  return key;
}

std::optional<std::string> signature(EVP_PKEY* key, const EVP_MD* digest, std::string_view bytes) {
  DigestPointer context(EVP_MD_CTX_new());
  size_t length = 0;
  const auto* data = reinterpret_cast<const unsigned char*>(bytes.data());
  if (EVP_DigestSignInit(context.get(), nullptr, digest, nullptr, key) != 1 ||
      EVP_DigestSign(context.get(), nullptr, &length, data, bytes.size()) != 1)
    return std::nullopt;
  std::string out(length, '\0');
  if (EVP_DigestSign(context.get(), reinterpret_cast<unsigned char*>(out.data()), &length, data,
                     bytes.size()) != 1)
    return std::nullopt;
  out.resize(length);
  return out;
}

void warnAboutFilters(const Dictionary& client, const std::string& where, std::vector<std::string>& out) {
  const Array* filters = client.array("filters");
  if (filters == nullptr) {
    out.push_back(where + ": no \"filters\" array: sessions that require user information are disabled");
    return;
  }
  size_t index = 0;
  for (const Value& element : *filters) {
    const std::string at = where + ", filter " + std::to_string(index++);
    const Dictionary* filter = element.dictionary();
    if (filter == nullptr) {
      out.push_back(at + ": not a dictionary");
      continue;
    }
    const String* action = filter->string("action");
    if (action == nullptr || (*action != "remove" && *action != "sha256"))
      out.push_back(at + ": the action is neither \"remove\" nor \"sha256\" (case counts): the key is kept");
    if (!filter->contains("key")) out.push_back(at + ": no \"key\": it matches nothing");
    if (filter->contains("method") || filter->contains("status"))
      out.push_back(
          at +
          ": bound to a method or status: it does not touch the copy of the user information that a flush"
          " merges into batched events (that copy has neither)");
  }
}

// A session may meet one entry after another, as its user information changes.
void warnAboutWhatStays(const Array& clients, const std::string& where, std::vector<std::string>& out) {
  for (const char* key : {"expedite", "custom_clientId", "override_sampling"}) {
    size_t entries = 0, having = 0;
    for (const Value& element : clients) {
      const Dictionary* client = element.dictionary();
      if (client == nullptr) continue;
      ++entries;
      if (client->contains(key)) ++having;
    }
    if (having != 0 && having != entries)
      out.push_back(where + ": only some clients have \"" + key +
                    "\": a session that goes on from one of these to another may keep what the first said");
  }
}

void warnAboutClients(const Dictionary& backend, const std::string& where, std::vector<std::string>& out) {
  const Array* clients = backend.array("clients");
  if (clients == nullptr) {
    out.push_back(where + ": no \"clients\" array: the back end is not created");
    return;
  }
  size_t index = 0;
  for (const Value& element : *clients) {
    const std::string at = where + ", client " + std::to_string(index++);
    const Dictionary* client = element.dictionary();
    if (client == nullptr) {
      out.push_back(at + ": not a dictionary");
      continue;
    }
    const Array* locales = client->array("locale_whitelist");
    if (locales == nullptr || locales->empty())
      out.push_back(at + ": no \"locale_whitelist\": sessions that require user information are disabled");
    if (!client->contains("sampling_threshold") && !client->contains("per_country_sampling_thresholds"))
      out.push_back(at + ": no \"sampling_threshold\": sessions that require user information are disabled");
    if (!client->contains("post_url")) out.push_back(at + ": no \"post_url\": events have nowhere to go");
    if (!client->contains("event_threshold"))
      out.push_back(at +
                    ": no \"event_threshold\": it is 0, and nearly every batched event flushes the batch");
    warnAboutFilters(*client, at, out);
  }
  warnAboutWhatStays(*clients, where, out);
}

}  // namespace

std::variant<KeyPair, Error> makeKeyPair(unsigned bits) {
  if (bits < 2048 || bits > 16384) return failure("a key has between 2048 and 16384 bits");
  KeyPointer key(EVP_RSA_gen(bits));
  if (!key) return failure("no key could be made");
  BIOPointer pem(BIO_new(BIO_s_mem())), der(BIO_new(BIO_s_mem()));
  if (PEM_write_bio_PKCS8PrivateKey(pem.get(), key.get(), nullptr, nullptr, 0, nullptr, nullptr) != 1 ||
      i2d_PUBKEY_bio(der.get(), key.get()) != 1)
    return failure("the key could not be written");
  return KeyPair{contents(pem.get()), contents(der.get())};
}

std::variant<Dictionary, Error> StorebagFile::read(std::string_view text, std::string_view format) const {
  std::variant<Value, Error> parsed = failure("unknown format: a bag is .json, .toml or .plist");
  if (format == "json") parsed = json_.parse(text);
  if (format == "toml") parsed = parseToml(text);
  if (format == "plist") parsed = propertyLists_.parse(text);
  if (auto* error = std::get_if<Error>(&parsed)) return std::move(*error);
  if (const Dictionary* bag = std::get<Value>(parsed).dictionary()) return *bag;
  return failure("the root of a bag is a dictionary");
}

std::variant<std::string, Error> StorebagFile::sign(const Dictionary& bag,
                                                    std::string_view privateKeyPEM) const {
  const Value* version = bag.find("version");
  if (version == nullptr || !version->isString()) return failure("a bag needs a \"version\" text");
  const KeyPointer key = privateKey(privateKeyPEM);
  if (!key) return failure("this is no RSA private key in PEM form");
  const std::string bytes = propertyLists_.serialize(bag);
  const std::optional<std::string> signed_ = signature(key.get(), EVP_sha1(), bytes);
  const std::optional<std::string> signed256 = signature(key.get(), EVP_sha256(), bytes);
  if (!signed_ || !signed256) return failure("the bag could not be signed");
  Dictionary document;
  document.set("signature", base64(std::as_bytes(std::span(*signed_))));
  document.set("signature256", base64(std::as_bytes(std::span(*signed256))));
  document.set("bag", base64(std::as_bytes(std::span(bytes))));
  return propertyLists_.serialize(document);
}

std::variant<Dictionary, Error> StorebagFile::open(std::string_view document,
                                                   std::optional<std::string_view> publicKeyDER) const {
  std::variant<Value, Error> parsed = propertyLists_.parse(document);
  if (auto* error = std::get_if<Error>(&parsed)) return std::move(*error);
  const Dictionary* root = std::get<Value>(parsed).dictionary();
  if (root == nullptr) return failure("the root of a storebag is a dictionary");
  const auto decoded = [root](std::string_view key) -> std::optional<Data> {
    const String* text = root->string(key);
    return text != nullptr ? base64Decode(*text) : std::nullopt;
  };
  const std::optional<Data> signed_ = decoded("signature"), bag = decoded("bag");
  if (!signed_ || !bag) return failure("\"signature\" and \"bag\" must be base64 texts");
  if (publicKeyDER) {
    const auto key = cryptography_.publicKeyFromDER(std::as_bytes(std::span(*publicKeyDER)));
    if (!key) return failure("the public key is no RSA SubjectPublicKeyInfo in DER form");
    if (!key->verifySHA1(cryptography_.sha1(bag->bytes()), signed_->bytes()))
      return failure("the signature does not match the bag and this key");
    const std::optional<Data> signed256 = decoded("signature256");
    if (root->contains("signature256") &&
        (!signed256 || !key->verifySHA256(cryptography_.sha256(bag->bytes()), signed256->bytes())))
      return failure("the signature over SHA-256 does not match the bag and this key");
  }
  return read(bag->view(), "plist");
}

std::variant<Dictionary, Error> StorebagFile::openOrRead(const std::string& path) const {
  auto text = readFile(path);
  if (auto* error = std::get_if<Error>(&text)) return std::move(*error);
  const std::string& bytes = std::get<std::string>(text);
  auto bag = open(bytes, std::nullopt);
  const size_t dot = path.rfind('.');
  if (std::holds_alternative<Error>(bag))
    bag = read(bytes, dot == std::string::npos ? "" : path.substr(dot + 1));
  if (auto* error = std::get_if<Error>(&bag))
    error->localizedDescription = path + ": " + error->localizedDescription;
  return bag;
}

std::vector<std::string> StorebagFile::warnings(const Dictionary& bag) {
  std::vector<std::string> out;
  if (const Value* version = bag.find("version"); version == nullptr || !version->isString())
    out.emplace_back("no \"version\" text: daemons refuse the bag");
  if (const Value* cycle = bag.find("refresh_cycle"); cycle != nullptr && cycle->intValue() > 86400)
    out.emplace_back("\"refresh_cycle\" is over 86400 seconds: it counts as 86400");
  bool any = false;
  for (const char* section : {"development", "vantu_internal", "seed", "release"}) {
    const Dictionary* table = bag.dictionary(section);
    if (table == nullptr) continue;
    any = true;
    for (const char* name : {"httppost", "httppost2", "qrs"})
      if (const Dictionary* backend = table->dictionary(name))
        warnAboutClients(*backend, std::string(section) + "/" + name, out);
  }
  if (!any) out.emplace_back("no section: development, vantu_internal, seed or release");
  return out;
}

}  // namespace kyt::tools
