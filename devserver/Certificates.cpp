#include "devserver/Certificates.h"

#include <openssl/asn1.h>
#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/ec.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <optional>

#include "devserver/Files.h"

namespace kyt::devserver {
namespace {

template <auto release>
struct Release {
  void operator()(auto* object) const { release(object); }
};
using Key = std::unique_ptr<EVP_PKEY, Release<EVP_PKEY_free>>;
using Certificate = std::unique_ptr<X509, Release<X509_free>>;
using Memory = std::unique_ptr<BIO, Release<BIO_free_all>>;

constexpr long kDay = 24 * 60 * 60;
constexpr long kAuthorityLifetime = 3650 * kDay;
constexpr long kServerLifetime = 397 * kDay;
constexpr long kRenewBefore = 30 * kDay;
constexpr size_t kMaxPEM = 64 * 1024;

struct Pair {
  Certificate certificate;
  Key key;
};

Memory memoryOf(const std::string& text) {
  return Memory(BIO_new_mem_buf(text.data(), static_cast<int>(text.size())));
}

std::string textOf(BIO* memory) {
  char* bytes = nullptr;
  const long size = BIO_get_mem_data(memory, &bytes);
  return size > 0 ? std::string(bytes, static_cast<size_t>(size)) : std::string();
}

std::string pemOf(X509* certificate) {
  const Memory memory(BIO_new(BIO_s_mem()));
  PEM_write_bio_X509(memory.get(), certificate);
  return textOf(memory.get());
}

std::string pemOf(EVP_PKEY* key) {
  const Memory memory(BIO_new(BIO_s_mem()));
  PEM_write_bio_PKCS8PrivateKey(memory.get(), key, nullptr, nullptr, 0, nullptr, nullptr);
  return textOf(memory.get());
}

std::optional<Pair> readPair(const std::filesystem::path& folder, const std::string& name) {
  const auto certificateText = readFile(folder / (name + ".pem"), kMaxPEM);
  const auto keyText = readFile(folder / (name + "-key.pem"), kMaxPEM);
  if (!certificateText || !keyText) return std::nullopt;
  Pair pair{Certificate(PEM_read_bio_X509(memoryOf(*certificateText).get(), nullptr, nullptr, nullptr)),
            Key(PEM_read_bio_PrivateKey(memoryOf(*keyText).get(), nullptr, nullptr, nullptr))};
  if (!pair.certificate || !pair.key) return std::nullopt;
  if (X509_check_private_key(pair.certificate.get(), pair.key.get()) != 1) return std::nullopt;
  time_t limit = time(nullptr) + kRenewBefore;
  if (X509_cmp_time(X509_get0_notAfter(pair.certificate.get()), &limit) <= 0) return std::nullopt;
  return pair;
}

bool setExtension(X509* certificate, X509V3_CTX& context, int which, const std::string& value) {
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, which, value.c_str());
  if (extension == nullptr) return false;
  const bool added = X509_add_ext(certificate, extension, -1) == 1;
  X509_EXTENSION_free(extension);
  return added;
}

bool setRandomSerial(X509* certificate) {
  const std::unique_ptr<BIGNUM, Release<BN_free>> number(BN_new());
  return number && BN_rand(number.get(), 127, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) == 1 &&
         BN_to_ASN1_INTEGER(number.get(), X509_get_serialNumber(certificate)) != nullptr;
}

struct Extension {
  int which;
  std::string value;
};

// A new key and its certificate, signed by `issuer` or, without one, by itself.
std::optional<Pair> makePair(const std::string& commonName, long lifetime,
                             const std::vector<Extension>& extensions, const Pair* issuer) {
  Pair pair{Certificate(X509_new()), Key(EVP_EC_gen("P-256"))};
  X509* certificate = pair.certificate.get();
  if (certificate == nullptr || !pair.key || !setRandomSerial(certificate)) return std::nullopt;
  X509_set_version(certificate, X509_VERSION_3);
  X509_gmtime_adj(X509_getm_notBefore(certificate), -kDay);
  X509_gmtime_adj(X509_getm_notAfter(certificate), lifetime);
  X509_set_pubkey(certificate, pair.key.get());
  X509_NAME_add_entry_by_txt(X509_get_subject_name(certificate), "CN", MBSTRING_UTF8,
                             reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1, 0);
  X509* signer = issuer != nullptr ? issuer->certificate.get() : certificate;
  X509_set_issuer_name(certificate, X509_get_subject_name(signer));
  X509V3_CTX context;
  X509V3_set_ctx(&context, signer, certificate, nullptr, nullptr, 0);
  for (const Extension& extension : extensions) {
    if (!setExtension(certificate, context, extension.which, extension.value)) return std::nullopt;
  }
  EVP_PKEY* key = issuer != nullptr ? issuer->key.get() : pair.key.get();
  if (X509_sign(certificate, key, EVP_sha256()) == 0) return std::nullopt;
  return pair;
}

bool isAddress(const std::string& host) {
  return host.find_first_not_of("0123456789.") == std::string::npos || host.find(':') != std::string::npos;
}

bool covers(X509* certificate, const std::vector<std::string>& hosts) {
  return std::all_of(hosts.begin(), hosts.end(), [&](const std::string& host) {
    return isAddress(host) ? X509_check_ip_asc(certificate, host.c_str(), 0) == 1
                           : X509_check_host(certificate, host.c_str(), host.size(), 0, nullptr) == 1;
  });
}

std::optional<Pair> makeAuthority() {
  return makePair("kytdevserver development CA", kAuthorityLifetime,
                  {{NID_basic_constraints, "critical,CA:TRUE,pathlen:0"},
                   {NID_key_usage, "critical,keyCertSign,cRLSign"},
                   {NID_subject_key_identifier, "hash"}},
                  nullptr);
}

std::optional<Pair> makeServer(const Pair& authority, const std::vector<std::string>& hosts) {
  std::string names;
  for (const std::string& host : hosts) {
    names += (names.empty() ? "" : ",") + std::string(isAddress(host) ? "IP:" : "DNS:") + host;
  }
  return makePair("kytdevserver", kServerLifetime,
                  {{NID_basic_constraints, "critical,CA:FALSE"},
                   {NID_key_usage, "critical,digitalSignature"},
                   {NID_ext_key_usage, "serverAuth"},
                   {NID_subject_alt_name, names},
                   {NID_subject_key_identifier, "hash"},
                   {NID_authority_key_identifier, "keyid:always"}},
                  &authority);
}

// Why the pair could not be written, or nothing.
std::optional<std::string> writePair(const std::filesystem::path& folder, const std::string& name,
                                     const Pair& pair) {
  if (replaceFile(folder / (name + "-key.pem"), pemOf(pair.key.get()), 0600) &&
      replaceFile(folder / (name + ".pem"), pemOf(pair.certificate.get()), 0644)) {
    return std::nullopt;
  }
  return "can't write " + (folder / (name + ".pem")).string() + " or its key: " + std::strerror(errno);
}

}  // namespace

std::variant<Identity, std::string> serverIdentity(const std::filesystem::path& folder,
                                                   const std::vector<std::string>& hosts) {
  std::optional<Pair> authority = readPair(folder, "ca");
  if (!authority) {
    authority = makeAuthority();
    if (!authority) return "can't make a certificate authority";
    if (auto error = writePair(folder, "ca", *authority)) return *error;
  }
  std::optional<Pair> server = readPair(folder, "server");
  if (!server || X509_verify(server->certificate.get(), authority->key.get()) != 1 ||
      !covers(server->certificate.get(), hosts)) {
    server = makeServer(*authority, hosts);
    if (!server) return "can't make a server certificate: is every host a name or an address?";
    if (auto error = writePair(folder, "server", *server)) return *error;
  }
  return Identity{pemOf(server->certificate.get()), pemOf(server->key.get())};
}

}  // namespace kyt::devserver
