// A bundle whose version and resources a test sets, before others read it.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/Bundle.h"

namespace kyt {

class FakeBundle final : public Bundle {
 public:
  explicit FakeBundle(std::optional<std::string> version = "8.0") : version_(std::move(version)) {}
  void setVersion(std::optional<std::string> version) { version_ = std::move(version); }
  // Named as a caller asks for it: setResource("publicKey", "der", bytes).
  void setResource(std::string_view name, std::string_view type, Data bytes) {
    resources_[{std::string(name), std::string(type)}] = std::move(bytes);
  }
  void removeResource(std::string_view name, std::string_view type) {
    resources_.erase({std::string(name), std::string(type)});
  }
  [[nodiscard]] std::optional<String> version() override {
    if (!version_) return std::nullopt;
    return String(std::string_view(*version_));
  }
  [[nodiscard]] std::optional<Data> resource(std::string_view name, std::string_view type) override {
    auto found = resources_.find({std::string(name), std::string(type)});
    if (found == resources_.end()) return std::nullopt;
    return found->second;
  }

 private:
  std::optional<std::string> version_;
  std::map<std::pair<std::string, std::string>, Data> resources_;
};

}  // namespace kyt
