// Lets a bag without a signature pass where the fetcher asks for one: for bags that people are still writing. The document
// around it is made here, its signature is empty, and every key and every signature holds. One thread.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/Bundle.h"
#include "platform/Cryptography.h"
#include "platform/PropertyLists.h"
#include "platform/objects/Base64.h"

namespace kyt::tools {

// The document that a server would hand out.
[[nodiscard]] inline std::string unsignedDocument(const Dictionary& bag, PropertyLists& propertyLists) {
  const std::string bytes = propertyLists.serialize(bag);
  return propertyLists.serialize(
      Dictionary{{"signature", ""}, {"signature256", ""}, {"bag", base64(std::as_bytes(std::span(bytes)))}});
}

class AnySignature final : public Cryptography {
 public:
  explicit AnySignature(Cryptography& real) : real_(real) {}
  [[nodiscard]] std::array<std::byte, 20> sha1(Bytes bytes) override { return real_.sha1(bytes); }
  [[nodiscard]] std::array<std::byte, 32> sha256(Bytes bytes) override { return real_.sha256(bytes); }
  [[nodiscard]] std::array<std::byte, 20> hmacSHA1(Bytes key, Bytes bytes) override {
    return real_.hmacSHA1(key, bytes);
  }
  [[nodiscard]] std::unique_ptr<PublicKey> publicKeyFromDER(Bytes) override {
    return std::make_unique<AnyKey>();
  }

 private:
  class AnyKey final : public PublicKey {
   public:
    [[nodiscard]] bool verifySHA1(const std::array<std::byte, 20>&, Bytes) const override { return true; }
    [[nodiscard]] bool verifySHA256(const std::array<std::byte, 32>&, Bytes) const override { return true; }
  };
  Cryptography& real_;
};

// A bundle that always has a key.
class AnyKeyBundle final : public Bundle {
 public:
  explicit AnyKeyBundle(Bundle& real) : real_(real) {}
  [[nodiscard]] std::optional<String> version() override { return real_.version(); }
  [[nodiscard]] std::optional<Data> resource(std::string_view, std::string_view) override {
    return Data(std::string_view("key"));
  }

 private:
  Bundle& real_;
};

}  // namespace kyt::tools
