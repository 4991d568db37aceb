// GET and PUT on the development server's plain loopback port.
#pragma once

#include <optional>
#include <string>

namespace kyt::tools {

struct HttpAnswer {
  long status = 0;
  std::string body;
};
// None when nobody answers. Blocks, at most `seconds`.
[[nodiscard]] std::optional<HttpAnswer> httpGet(const std::string& url, long seconds = 30);
[[nodiscard]] std::optional<HttpAnswer> httpPut(const std::string& url, const std::string& body);

}  // namespace kyt::tools
