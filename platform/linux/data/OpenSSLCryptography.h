// Digests, message authentication and signature verification with OpenSSL's EVP interface.
#pragma once

#include "platform/Cryptography.h"

namespace kyt {

class OpenSSLCryptography : public Cryptography {
 public:
  // Fetches the algorithms once, while files may still be read.
  OpenSSLCryptography();
  ~OpenSSLCryptography() override;
  OpenSSLCryptography(const OpenSSLCryptography&) = delete;
  OpenSSLCryptography& operator=(const OpenSSLCryptography&) = delete;

  [[nodiscard]] std::array<std::byte, 20> sha1(Bytes bytes) override;
  [[nodiscard]] std::array<std::byte, 32> sha256(Bytes bytes) override;
  [[nodiscard]] std::array<std::byte, 20> hmacSHA1(Bytes key, Bytes bytes) override;
  [[nodiscard]] std::unique_ptr<PublicKey> publicKeyFromDER(Bytes der) override;

 private:
  struct Algorithms;
  std::unique_ptr<Algorithms> algorithms_;
};

}  // namespace kyt
