#include "platform/UrlSession.h"

#include <algorithm>
#include <cctype>

namespace kyt {

std::optional<std::string_view> URLResponse::header(std::string_view name) const {
  const auto sameLetter = [](char a, char b) {
    return std::tolower(static_cast<unsigned char>(a)) == std::tolower(static_cast<unsigned char>(b));
  };
  for (const auto& [key, value] : headers)
    if (std::equal(key.begin(), key.end(), name.begin(), name.end(), sameLetter)) return value;
  return std::nullopt;
}

}  // namespace kyt
