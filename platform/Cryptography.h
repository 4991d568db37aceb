// Digests, message authentication and signature verification. Any thread, no state, never blocks.
#pragma once

#include <array>
#include <cstddef>
#include <memory>
#include <span>

namespace kyt {

using Bytes = std::span<const std::byte>;

// A public key that was read successfully; its address identifies it in log lines.
class PublicKey {
 public:
  virtual ~PublicKey() = default;
  // RSA PKCS#1 v1.5 over a SHA-1 digest.
  [[nodiscard]] virtual bool verifySHA1(const std::array<std::byte, 20>& digest, Bytes signature) const = 0;
  // The same over a SHA-256 digest.
  [[nodiscard]] virtual bool verifySHA256(const std::array<std::byte, 32>& digest, Bytes signature) const = 0;
};

class Cryptography {
 public:
  virtual ~Cryptography() = default;
  [[nodiscard]] virtual std::array<std::byte, 20> sha1(Bytes bytes) = 0;
  [[nodiscard]] virtual std::array<std::byte, 32> sha256(Bytes bytes) = 0;
  [[nodiscard]] virtual std::array<std::byte, 20> hmacSHA1(Bytes key, Bytes bytes) = 0;
  // A SubjectPublicKeyInfo in DER; null when it is not one of an RSA key.
  [[nodiscard]] virtual std::unique_ptr<PublicKey> publicKeyFromDER(Bytes der) = 0;
};

}  // namespace kyt
