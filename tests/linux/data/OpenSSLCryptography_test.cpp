#include "platform/linux/data/OpenSSLCryptography.h"

#include <gtest/gtest.h>
#include <openssl/ec.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt {
namespace {

Bytes bytesOf(std::string_view text) {
  return std::as_bytes(std::span(text.data(), text.size()));
}

template <size_t Size>
std::string hex(const std::array<std::byte, Size>& bytes) {
  return description(Data(std::span<const std::byte>(bytes)));
}

struct FreeKey {
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
using Key = std::unique_ptr<EVP_PKEY, FreeKey>;

std::vector<std::byte> derOf(EVP_PKEY* key) {
  unsigned char* der = nullptr;
  const int size = i2d_PUBKEY(key, &der);
  const auto* first = reinterpret_cast<const std::byte*>(der);
  std::vector<std::byte> bytes(first, first + size);
  OPENSSL_free(der);
  return bytes;
}

std::vector<std::byte> signature(EVP_PKEY* key, Bytes bytes, const EVP_MD* digest = EVP_sha1()) {
  EVP_MD_CTX* context = EVP_MD_CTX_new();
  size_t size = 0;
  const auto* data = reinterpret_cast<const unsigned char*>(bytes.data());
  EXPECT_EQ(EVP_DigestSignInit(context, nullptr, digest, nullptr, key), 1);
  EXPECT_EQ(EVP_DigestSign(context, nullptr, &size, data, bytes.size()), 1);
  std::vector<std::byte> result(size);
  EXPECT_EQ(
      EVP_DigestSign(context, reinterpret_cast<unsigned char*>(result.data()), &size, data, bytes.size()), 1);
  EVP_MD_CTX_free(context);
  result.resize(size);
  return result;
}

TEST(Cryptography, DigestsKnownTexts) {
  OpenSSLCryptography cryptography;
  EXPECT_EQ(hex(cryptography.sha1(bytesOf("abc"))), "<a9993e364706816aba3e25717850c26c9cd0d89d>");
  EXPECT_EQ(hex(cryptography.sha1({})), "<da39a3ee5e6b4b0d3255bfef95601890afd80709>");
  EXPECT_EQ(hex(cryptography.sha256(bytesOf("abc"))),
            "<ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad>");
}

TEST(Cryptography, AuthenticatesAsTheStandardsExamplesDo) {  // RFC 2202
  OpenSSLCryptography cryptography;
  EXPECT_EQ(hex(cryptography.hmacSHA1(bytesOf(std::string(20, '\x0b')), bytesOf("Hi There"))),
            "<b617318655057264e28bc0b6fb378c8ef146be00>");
  EXPECT_EQ(hex(cryptography.hmacSHA1(bytesOf("Jefe"), bytesOf("what do ya want for nothing?"))),
            "<effcdf6ae5eb2fa2d27416d5f184df9c259a7c79>");
  EXPECT_EQ(hex(cryptography.hmacSHA1(bytesOf(std::string(80, '\xaa')),
                                      bytesOf("Test Using Larger Than Block-Size Key - Hash Key First"))),
            "<aa4ae5e15272d00e95705637ce8a3b55ed402112>");
  EXPECT_EQ(hex(cryptography.hmacSHA1({}, {})), "<fbdb1d1b18aa6c08324b7d64b71fb76370690e1d>");
}

TEST(PublicKey, VerifiesWhatItsPrivateKeySigned) {
  const Key key(EVP_RSA_gen(2048));
  OpenSSLCryptography cryptography;
  const auto publicKey = cryptography.publicKeyFromDER(derOf(key.get()));
  ASSERT_NE(publicKey, nullptr);
  const Bytes text = bytesOf("a storebag");
  auto signedText = signature(key.get(), text);
  EXPECT_TRUE(publicKey->verifySHA1(cryptography.sha1(text), signedText));
  EXPECT_FALSE(publicKey->verifySHA1(cryptography.sha1(bytesOf("another")), signedText));
  EXPECT_FALSE(publicKey->verifySHA1(cryptography.sha1(text), {}));
  EXPECT_FALSE(publicKey->verifySHA1(cryptography.sha1(text), Bytes(signedText).first(255)));
  signedText[17] ^= std::byte{1};
  EXPECT_FALSE(publicKey->verifySHA1(cryptography.sha1(text), signedText));
  const Key other(EVP_RSA_gen(2048));
  EXPECT_FALSE(publicKey->verifySHA1(cryptography.sha1(text), signature(other.get(), text)));
}

TEST(PublicKey, TellsSignaturesOverTheTwoDigestsApart) {
  const Key key(EVP_RSA_gen(2048));
  OpenSSLCryptography cryptography;
  const auto publicKey = cryptography.publicKeyFromDER(derOf(key.get()));
  ASSERT_NE(publicKey, nullptr);
  const Bytes text = bytesOf("a storebag");
  const auto over1 = signature(key.get(), text), over256 = signature(key.get(), text, EVP_sha256());
  EXPECT_TRUE(publicKey->verifySHA256(cryptography.sha256(text), over256));
  EXPECT_FALSE(publicKey->verifySHA256(cryptography.sha256(text), over1));
  EXPECT_FALSE(publicKey->verifySHA1(cryptography.sha1(text), over256));
  EXPECT_FALSE(publicKey->verifySHA256(cryptography.sha256(bytesOf("another")), over256));
}

TEST(PublicKey, IsRefusedWhenItIsNoRSAKeyInDER) {
  OpenSSLCryptography cryptography;
  EXPECT_EQ(cryptography.publicKeyFromDER({}), nullptr);
  EXPECT_EQ(cryptography.publicKeyFromDER(bytesOf("-----BEGIN PUBLIC KEY-----")), nullptr);
  const Key curve(EVP_EC_gen("P-256"));
  EXPECT_EQ(cryptography.publicKeyFromDER(derOf(curve.get())), nullptr);
  const Key key(EVP_RSA_gen(2048));
  auto der = derOf(key.get());
  EXPECT_EQ(cryptography.publicKeyFromDER(Bytes(der).first(der.size() - 1)), nullptr);
  der.push_back(std::byte{0});
  EXPECT_EQ(cryptography.publicKeyFromDER(der), nullptr);
}

}  // namespace
}  // namespace kyt
