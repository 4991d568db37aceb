// User defaults that are read from where they are and written nowhere: what is stored is seen by this object alone, and is
// gone with it. One thread.
#pragma once

#include <algorithm>
#include <map>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/UserDefaults.h"

namespace kyt::tools {

class ScratchUserDefaults final : public UserDefaults {
 public:
  explicit ScratchUserDefaults(UserDefaults& stored) : stored_(stored) {}

  [[nodiscard]] Value value(std::string_view domain, std::string_view key) override {
    const auto own = own_.find({std::string(domain), std::string(key)});
    return own != own_.end() ? own->second : stored_.value(domain, key);
  }
  [[nodiscard]] std::optional<Error> set(std::string_view domain, std::string_view key,
                                         Value value) override {
    own_[{std::string(domain), std::string(key)}] = std::move(value);
    return std::nullopt;
  }
  using UserDefaults::stringOrStore;
  [[nodiscard]] String stringOrStore(std::string_view domain, std::string_view key, String made,
                                     std::optional<uint32_t> /*owner*/) override {
    const Value known = value(domain, key);
    if (const String* text = known.string()) return *text;
    own_[{std::string(domain), std::string(key)}] = Value(made);
    made_.push_back(made.str());
    return made;
  }

  // Whether it was made here, and is another one wherever it is made for good.
  [[nodiscard]] bool hasMade(std::string_view value) const {
    return std::find(made_.begin(), made_.end(), value) != made_.end();
  }

 private:
  UserDefaults& stored_;
  std::map<std::pair<std::string, std::string>, Value> own_;
  std::vector<std::string> made_;
};

}  // namespace kyt::tools
