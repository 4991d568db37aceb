// Confining the process. Each is called once, while the daemon starts.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace kyt {

// Entering the sandbox profile of that name. No value: confined. Otherwise the error's text; nothing else was set up.
class Confinement {
 public:
  virtual ~Confinement() = default;
  [[nodiscard]] virtual std::optional<std::string> enter(std::string_view profileName) = 0;
  // Once, when what only the start needs has been done: it is refused from now on. A value: an error's text.
  [[nodiscard]] virtual std::optional<std::string> endStart() = 0;
};

}  // namespace kyt
