// Undoes gzip within a limit. Any thread, no state.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <variant>

namespace kyt::http {

struct GzipError {
  std::string reason;
};

// Exactly one gzip member and nothing behind it; an output over `limit` bytes is an error.
[[nodiscard]] std::variant<std::string, GzipError> gunzip(std::string_view bytes, uint64_t limit);

}  // namespace kyt::http
