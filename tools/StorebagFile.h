// Storebags as files: reading a bag that people wrote (JSON, TOML or a property list), signing it into the
// document that servers hand out, verifying and opening such a document, and telling what in a bag will not
// do what its author may expect. Used by kytctl, by the demonstration and by tests. One thread; errors are
// values with a text for people.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt {

class PropertyLists;
class JSON;
class Cryptography;

namespace tools {

struct KeyPair {
  std::string privateKeyPEM;  // PKCS#8, unencrypted: the caller keeps the file's mode at 0600
  std::string publicKeyDER;   // SubjectPublicKeyInfo: the resource publicKey.der of KYTReporting.bundle
};

// A fresh RSA key pair. 2048 bits or more.
[[nodiscard]] std::variant<KeyPair, Error> makeKeyPair(unsigned bits);

class StorebagFile {
 public:
  StorebagFile(PropertyLists& propertyLists, JSON& json, Cryptography& cryptography)
      : propertyLists_(propertyLists), json_(json), cryptography_(cryptography) {}

  // The bag in `text`; `format` is "json", "toml" or "plist" (a file's extension).
  [[nodiscard]] std::variant<Dictionary, Error> read(std::string_view text, std::string_view format) const;
  // The document {"signature", "signature256", "bag"} as a server hands it out. Fails when the key is no RSA private key, and
  // for a bag that every daemon would refuse (no "version" text).
  [[nodiscard]] std::variant<std::string, Error> sign(const Dictionary& bag,
                                                      std::string_view privateKeyPEM) const;
  // The bag inside a document; with a public key (DER) only if its signature holds.
  [[nodiscard]] std::variant<Dictionary, Error> open(std::string_view document,
                                                     std::optional<std::string_view> publicKeyDER) const;
  // A document, its signature not checked, or a bag that nobody has signed yet; `path` is named in errors and tells
  // the format.
  [[nodiscard]] std::variant<Dictionary, Error> openOrRead(const std::string& path) const;
  // Sentences about what may surprise: one each, naming where.
  [[nodiscard]] static std::vector<std::string> warnings(const Dictionary& bag);

 private:
  PropertyLists& propertyLists_;
  JSON& json_;
  Cryptography& cryptography_;
};

// Whole files. Errors name the path and the reason.
[[nodiscard]] std::variant<std::string, Error> readFile(const std::string& path);
// Replaces the file atomically; `mode` as chmod takes it. Into a character device, and what /dev and /proc name (/dev/stdout),
// it writes; another thing that is no file stays, and is an error: whoever made it would read along.
[[nodiscard]] std::optional<Error> writeFile(const std::string& path, std::string_view bytes, unsigned mode);

}  // namespace tools
}  // namespace kyt
