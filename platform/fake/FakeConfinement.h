// Remembers the profiles that were asked for, and returns the error that a test gave it.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Confinement.h"

namespace kyt {

class FakeConfinement final : public Confinement {
 public:
  explicit FakeConfinement(std::optional<std::string> error = std::nullopt) : error_(std::move(error)) {}
  [[nodiscard]] std::optional<std::string> enter(std::string_view profileName) override {
    entered_.emplace_back(profileName);
    return error_;
  }
  [[nodiscard]] std::optional<std::string> endStart() override {
    startEnded_ = true;
    return error_;
  }
  [[nodiscard]] bool startEnded() const { return startEnded_; }
  // The profile names that were asked for, in order.
  [[nodiscard]] const std::vector<std::string>& entered() const { return entered_; }

 private:
  std::optional<std::string> error_;
  std::vector<std::string> entered_;
  bool startEnded_ = false;
};

}  // namespace kyt
