#include "tests/support/TestCertificates.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>

namespace kyt {
namespace {

using Key = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;
using Certificate = std::unique_ptr<X509, decltype(&X509_free)>;

Key newKey() {
  Key key(EVP_EC_gen("P-256"), EVP_PKEY_free);
  if (!key) throw std::runtime_error("cannot make a key");
  return key;
}

void addExtension(X509* certificate, X509* issuer, int kind, const std::string& value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, kind, value.c_str());
  if (extension == nullptr) throw std::runtime_error("cannot make extension " + value);
  X509_add_ext(certificate, extension, -1);
  X509_EXTENSION_free(extension);
}

Certificate newCertificate(EVP_PKEY* key, const std::string& name, X509* issuer, bool expired) {
  static int serial = 0;
  Certificate certificate(X509_new(), X509_free);
  X509* x = certificate.get();
  X509_set_version(x, 2);
  ASN1_INTEGER_set(X509_get_serialNumber(x), ++serial);
  X509_gmtime_adj(X509_getm_notBefore(x), -2 * 86400);
  X509_gmtime_adj(X509_getm_notAfter(x), expired ? -86400 : 86400);
  X509_set_pubkey(x, key);
  X509_NAME_add_entry_by_txt(X509_get_subject_name(x), "CN", MBSTRING_UTF8,
                             reinterpret_cast<const unsigned char*>(name.c_str()), -1, -1, 0);
  X509_set_issuer_name(x, X509_get_subject_name(issuer == nullptr ? x : issuer));
  if (issuer == nullptr) {
    addExtension(x, x, NID_basic_constraints, "critical,CA:TRUE");
    addExtension(x, x, NID_key_usage, "critical,keyCertSign,cRLSign");
    addExtension(x, x, NID_subject_key_identifier, "hash");
    if (X509_sign(x, key, EVP_sha256()) == 0) throw std::runtime_error("cannot sign");
  } else {
    addExtension(x, issuer, NID_authority_key_identifier, "keyid");
  }
  return certificate;
}

template <typename Write>
std::string pem(Write write) {
  BIO* memory = BIO_new(BIO_s_mem());
  write(memory);
  char* bytes = nullptr;
  const long size = BIO_get_mem_data(memory, &bytes);
  std::string text(bytes, static_cast<size_t>(size));
  BIO_free(memory);
  return text;
}

std::string pem(X509* certificate) {
  return pem([&](BIO* out) { PEM_write_bio_X509(out, certificate); });
}

}  // namespace

struct TestCertificateAuthority::Keys {
  Key key = newKey();
  Certificate certificate = newCertificate(key.get(), "Throw-away test authority", nullptr, false);
};

TestCertificateAuthority::TestCertificateAuthority() : keys_(std::make_unique<Keys>()) {
  std::string pattern = std::filesystem::temp_directory_path() / "kyt-test-ca-XXXXXX";
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("cannot make a temporary folder");
  folder_ = pattern;
  file_ = folder_ + "/ca.pem";
  std::ofstream(file_) << pem(keys_->certificate.get());
}

TestCertificateAuthority::~TestCertificateAuthority() {
  std::error_code ignored;
  std::filesystem::remove_all(folder_, ignored);
}

TestCertificate TestCertificateAuthority::issue(const std::vector<std::string>& names, bool expired) {
  const Key key = newKey();
  X509* issuer = keys_->certificate.get();
  const Certificate certificate = newCertificate(key.get(), names.front(), issuer, expired);
  std::string alternatives;
  for (const std::string& name : names) {
    const bool isAddress = name.find_first_not_of("0123456789.") == std::string::npos;
    alternatives += (alternatives.empty() ? "" : ",") + std::string(isAddress ? "IP:" : "DNS:") + name;
  }
  addExtension(certificate.get(), issuer, NID_subject_alt_name, alternatives);
  if (X509_sign(certificate.get(), keys_->key.get(), EVP_sha256()) == 0)
    throw std::runtime_error("cannot sign");
  return {pem(certificate.get()), pem([&](BIO* out) {
            PEM_write_bio_PrivateKey(out, key.get(), nullptr, nullptr, 0, nullptr, nullptr);
          })};
}

}  // namespace kyt
