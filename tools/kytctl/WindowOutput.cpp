#include "tools/kytctl/WindowOutput.h"

#include <pwd.h>

#include <charconv>
#include <cstdio>

#include "platform/base/TextEscape.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/StatusText.h"

namespace kyt::tools {

void printJSON(const Value& value) {
  std::printf("%s\n", compactJSON(value).c_str());
}

Value listed(const char* key, std::vector<Dictionary> rows) {
  Array array;
  for (Dictionary& row : rows) array.append(std::move(row));
  return Dictionary{{key, std::move(array)}};
}

std::string programText(const Dictionary& program) {
  std::string text;
  for (const char c : escapedName(textIn(program, "client"))) {
    if (c == ':')
      text += "\\x3a";
    else
      text += c;
  }
  return text + ":" + escapedName(textIn(program, "service"));
}

std::optional<uint32_t> userOf(const std::string& text) {
  uint32_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error == std::errc() && end == text.data() + text.size()) return number;
  const passwd* account = ::getpwnam(text.c_str());
  return account != nullptr ? std::optional<uint32_t>(account->pw_uid) : std::nullopt;
}

}  // namespace kyt::tools
