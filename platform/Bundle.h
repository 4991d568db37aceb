// A bundle: a folder with info.toml, read at start-up, and resources, each read when it is asked for. Any thread.
#pragma once

#include <optional>
#include <string_view>

#include "platform/objects/Value.h"

namespace kyt {

class Bundle {
 public:
  virtual ~Bundle() = default;
  [[nodiscard]] virtual std::optional<String> version() = 0;
  [[nodiscard]] virtual std::optional<Data> resource(std::string_view name, std::string_view type) = 0;
};

}  // namespace kyt
