#include "tests/support/SignedBag.h"

#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <cstdlib>
#include <memory>
#include <vector>

#include "platform/objects/Base64.h"

namespace kyt {

namespace {

struct FreeKey {
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
struct FreeContext {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};
using Key = std::unique_ptr<EVP_PKEY, FreeKey>;

Key makeKey() {
  Key key(EVP_RSA_gen(2048U));
  if (key == nullptr) std::abort();
  return key;
}

EVP_PKEY* signingKey() {
  static const Key key = makeKey();
  return key.get();
}

Data publicKeyOf(EVP_PKEY* key) {
  unsigned char* der = nullptr;
  const int length = i2d_PUBKEY(key, &der);
  if (length <= 0) std::abort();
  Data data(std::string_view(reinterpret_cast<const char*>(der), static_cast<size_t>(length)));
  OPENSSL_free(der);
  return data;
}

std::string sign(std::string_view bytes, const EVP_MD* digest) {
  const std::unique_ptr<EVP_MD_CTX, FreeContext> context(EVP_MD_CTX_new());
  size_t length = 0;
  const auto* data = reinterpret_cast<const unsigned char*>(bytes.data());
  if (EVP_DigestSignInit(context.get(), nullptr, digest, nullptr, signingKey()) != 1 ||
      EVP_DigestSign(context.get(), nullptr, &length, data, bytes.size()) != 1)
    std::abort();
  std::string signature(length, '\0');
  if (EVP_DigestSign(context.get(), reinterpret_cast<unsigned char*>(signature.data()), &length, data,
                     bytes.size()) != 1)
    std::abort();
  signature.resize(length);
  return signature;
}

}  // namespace

Data testPublicKey() {
  return publicKeyOf(signingKey());
}

Data otherPublicKey() {
  static const Key key = makeKey();
  return publicKeyOf(key.get());
}

std::string signedDocument(std::string_view bagBytes, PropertyLists& propertyLists) {
  const std::string signature = sign(bagBytes, EVP_sha1());
  return propertyLists.serialize(Dictionary{{"signature", base64(std::as_bytes(std::span(signature)))},
                                            {"bag", base64(std::as_bytes(std::span(bagBytes)))}});
}

std::string signedBag(const Dictionary& bag, PropertyLists& propertyLists) {
  return signedDocument(propertyLists.serialize(bag), propertyLists);
}

std::string doublySignedBag(const Dictionary& bag, PropertyLists& propertyLists) {
  const std::string bytes = propertyLists.serialize(bag);
  const std::string first = sign(bytes, EVP_sha1()), second = sign(bytes, EVP_sha256());
  return propertyLists.serialize(Dictionary{{"signature", base64(std::as_bytes(std::span(first)))},
                                            {"signature256", base64(std::as_bytes(std::span(second)))},
                                            {"bag", base64(std::as_bytes(std::span(bytes)))}});
}

Dictionary releaseBag(const Dictionary& section, const char* version) {
  return Dictionary{{"version", version}, {"release", section}};
}

}  // namespace kyt
