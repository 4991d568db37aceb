#include "platform/linux/data/OpenSSLCryptography.h"

#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <cstdlib>

namespace kyt {
namespace {

template <auto free>
struct Free {
  template <typename T>
  void operator()(T* object) const {
    free(object);
  }
};
using Digest = std::unique_ptr<EVP_MD, Free<EVP_MD_free>>;
using MAC = std::unique_ptr<EVP_MAC, Free<EVP_MAC_free>>;
using MACContext = std::unique_ptr<EVP_MAC_CTX, Free<EVP_MAC_CTX_free>>;
using Key = std::unique_ptr<EVP_PKEY, Free<EVP_PKEY_free>>;
using KeyContext = std::unique_ptr<EVP_PKEY_CTX, Free<EVP_PKEY_CTX_free>>;

const unsigned char* octets(Bytes bytes) {
  return reinterpret_cast<const unsigned char*>(bytes.data());
}

// A digest of memory fails only when memory is exhausted or the library is broken: no result would be an
// honest one.
void require(bool succeeded) {
  if (!succeeded) std::abort();
}

template <size_t Size>
std::array<std::byte, Size> digest(const EVP_MD* algorithm, Bytes bytes) {
  std::array<std::byte, Size> result{};
  unsigned length = 0;
  require(EVP_Digest(bytes.data(), bytes.size(), reinterpret_cast<unsigned char*>(result.data()), &length,
                     algorithm, nullptr) == 1 &&
          length == Size);
  return result;
}

class RSAPublicKey : public PublicKey {
 public:
  RSAPublicKey(Key key, const EVP_MD* sha1, const EVP_MD* sha256)
      : key_(std::move(key)), sha1_(sha1), sha256_(sha256) {}

  [[nodiscard]] bool verifySHA1(const std::array<std::byte, 20>& hash, Bytes signature) const override {
    return verifies(sha1_, hash, signature);
  }
  [[nodiscard]] bool verifySHA256(const std::array<std::byte, 32>& hash, Bytes signature) const override {
    return verifies(sha256_, hash, signature);
  }

 private:
  [[nodiscard]] bool verifies(const EVP_MD* algorithm, Bytes hash, Bytes signature) const {
    const KeyContext context(EVP_PKEY_CTX_new_from_pkey(nullptr, key_.get(), nullptr));
    return context != nullptr && EVP_PKEY_verify_init(context.get()) == 1 &&
           EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) == 1 &&
           EVP_PKEY_CTX_set_signature_md(context.get(), algorithm) == 1 &&
           EVP_PKEY_verify(context.get(), octets(signature), signature.size(), octets(hash), hash.size()) ==
               1;
  }

  Key key_;
  // Of the Cryptography object, which outlives its keys.
  const EVP_MD* sha1_;
  const EVP_MD* sha256_;
};

}  // namespace

struct OpenSSLCryptography::Algorithms {
  Digest sha1{EVP_MD_fetch(nullptr, "SHA1", nullptr)};
  Digest sha256{EVP_MD_fetch(nullptr, "SHA256", nullptr)};
  MAC hmac{EVP_MAC_fetch(nullptr, "HMAC", nullptr)};
  // Fetched again by name, the digest inside would cost more than the authentication itself: contexts are
  // duplicated from this one, which has it already.
  MACContext prototype;
};

OpenSSLCryptography::OpenSSLCryptography() : algorithms_(std::make_unique<Algorithms>()) {
  require(algorithms_->sha1 != nullptr && algorithms_->sha256 != nullptr && algorithms_->hmac != nullptr);
  char name[] = "SHA1";
  const OSSL_PARAM parameters[] = {OSSL_PARAM_construct_utf8_string("digest", name, 0),
                                   OSSL_PARAM_construct_end()};
  algorithms_->prototype.reset(EVP_MAC_CTX_new(algorithms_->hmac.get()));
  require(algorithms_->prototype != nullptr &&
          EVP_MAC_CTX_set_params(algorithms_->prototype.get(), parameters) == 1);
}

OpenSSLCryptography::~OpenSSLCryptography() = default;

std::array<std::byte, 20> OpenSSLCryptography::sha1(Bytes bytes) {
  return digest<20>(algorithms_->sha1.get(), bytes);
}

std::array<std::byte, 32> OpenSSLCryptography::sha256(Bytes bytes) {
  return digest<32>(algorithms_->sha256.get(), bytes);
}

std::array<std::byte, 20> OpenSSLCryptography::hmacSHA1(Bytes key, Bytes bytes) {
  static constexpr unsigned char kEmptyKey[1] = {0};  // a null key would mean "keep the last one"
  std::array<std::byte, 20> result{};
  size_t length = 0;
  const MACContext context(EVP_MAC_CTX_dup(algorithms_->prototype.get()));
  require(context != nullptr &&
          EVP_MAC_init(context.get(), key.empty() ? kEmptyKey : octets(key), key.size(), nullptr) == 1 &&
          EVP_MAC_update(context.get(), octets(bytes), bytes.size()) == 1 &&
          EVP_MAC_final(context.get(), reinterpret_cast<unsigned char*>(result.data()), &length,
                        result.size()) == 1 &&
          length == result.size());
  return result;
}

std::unique_ptr<PublicKey> OpenSSLCryptography::publicKeyFromDER(Bytes der) {
  if (der.size() > 65536) return nullptr;
  const unsigned char* next = octets(der);
  Key key(d2i_PUBKEY(nullptr, &next, static_cast<long>(der.size())));
  // Bytes that follow the key would be ignored by a lenient reader; a key file has none.
  if (key == nullptr || next != octets(der) + der.size() || EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA)
    return nullptr;
  return std::make_unique<RSAPublicKey>(std::move(key), algorithms_->sha1.get(), algorithms_->sha256.get());
}

}  // namespace kyt
