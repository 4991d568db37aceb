// Signs the storebags that people write into the folder, so that a developer edits a bag and the next fetch
// has it. Constant after construction, any thread.
#pragma once

#include <string>
#include <string_view>
#include <variant>

namespace kyt::devserver {

struct SigningError {
  std::string reason;
};

class BagSigner {
 public:
  explicit BagSigner(std::string privateKeyPEM) : key_(std::move(privateKeyPEM)) {}

  // The document to be served for a bag in `format`: "toml", "json" or "plist".
  [[nodiscard]] std::variant<std::string, SigningError> sign(std::string_view bag,
                                                             std::string_view format) const;

 private:
  const std::string key_;
};

}  // namespace kyt::devserver
