#include "session/FileURL.h"

#include <string>
#include <string_view>

#include "platform/base/Hex.h"

namespace kyt {

namespace {

constexpr size_t kLongestPath = 4095;  // of any file here; a longer one would only fill logs and requests

}  // namespace

std::optional<String> pathOfFileURL(const String& url) {
  std::string_view rest = url;
  constexpr std::string_view scheme = "file://", localhost = "localhost";
  if (!rest.starts_with(scheme)) return std::nullopt;
  rest.remove_prefix(scheme.size());
  if (rest.starts_with(localhost)) rest.remove_prefix(localhost.size());
  if (!rest.starts_with('/')) return std::nullopt;
  rest = rest.substr(0, rest.find_first_of("?#"));

  std::string path;
  path.reserve(rest.size());
  for (size_t i = 0; i < rest.size(); ++i) {
    char c = rest[i];
    if (c == '%') {
      const int high = i + 1 < rest.size() ? hexDigit(rest[i + 1]) : -1;
      const int low = i + 2 < rest.size() ? hexDigit(rest[i + 2]) : -1;
      if (high < 0 || low < 0) return std::nullopt;
      c = static_cast<char>(high * 16 + low);
      i += 2;
    }
    if (c == '\0') return std::nullopt;
    path.push_back(c);
  }
  if (path.size() > kLongestPath) return std::nullopt;
  return String(path);
}

}  // namespace kyt
