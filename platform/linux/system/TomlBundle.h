// A bundle: a folder with info.toml (`version = "8.0"`) and resources named NAME.TYPE. All of it is read at
// construction, before the daemon is confined, and constant afterwards. A missing or bad info.toml means no
// version, a missing resource no resource: what that means is its user's to say.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Log.h"
#include "platform/System.h"

namespace kyt {

class TomlBundle final : public Bundle {
 public:
  static constexpr size_t kMaxResourceBytes = 1u << 20;

  TomlBundle(const std::string& folder, Log& log);
  [[nodiscard]] std::optional<String> version() override { return version_; }
  [[nodiscard]] std::optional<Data> resource(std::string_view name, std::string_view type) override;

 private:
  std::optional<String> version_;
  std::map<std::string, Data, std::less<>> resources_;  // by file name
};

}  // namespace kyt
