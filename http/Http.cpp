#include "http/Http.h"

#include <algorithm>

#include "http/Text.h"

namespace kyt::http {

const std::string* findHeader(const std::vector<Header>& headers, std::string_view name) {
  const auto found = std::find_if(headers.begin(), headers.end(),
                                  [&](const Header& header) { return equalIgnoringCase(header.name, name); });
  return found == headers.end() ? nullptr : &found->value;
}

Reply textReply(unsigned status, std::string text) {
  Reply reply;
  reply.status = status;
  reply.body = std::move(text);
  return reply;
}

const std::string* Request::header(std::string_view name) const {
  return findHeader(headers, name);
}

std::optional<std::string_view> Request::argument(std::string_view name) const {
  for (const Header& argument : arguments) {
    if (argument.name == name) return argument.value;
  }
  return std::nullopt;
}

}  // namespace kyt::http
