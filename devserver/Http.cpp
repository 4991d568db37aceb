#include "devserver/Http.h"

#include "devserver/PostChecker.h"

namespace kyt::devserver {

const std::string* Request::header(std::string_view name) const {
  return findHeader(headers, name);
}

std::optional<std::string_view> Request::argument(std::string_view name) const {
  for (const Header& argument : arguments) {
    if (argument.name == name) return argument.value;
  }
  return std::nullopt;
}

}  // namespace kyt::devserver
