// A failure as a value: what is handed to completions and clients. `domain` says whose numbering `code` is.
#pragma once

#include <cstdint>
#include <string>

namespace kyt {

struct Error {
  std::string domain;
  int32_t code = 0;
  std::string localizedDescription;
  friend bool operator==(const Error&, const Error&) = default;
};

}  // namespace kyt
