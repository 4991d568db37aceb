#include "tools/kytctl/JSONText.h"

#include <string_view>

#include "platform/base/TextEscape.h"
#include "platform/linux/data/RapidJSON.h"

namespace kyt::tools {

std::string compactJSON(const Value& value) {
  std::string text;
  RapidJSON().writeCompact(value, text);
  return isPlainLines(text) ? text : escapedJSON(text);
}

// No line break stands in a text of the JSON.
std::string prettyJSON(const Value& value) {
  std::string text;
  RapidJSON().writePretty(value, text);
  if (isPlainLines(text)) return text;
  std::string harmless;
  std::string_view rest = text;
  for (size_t end = 0; (end = rest.find('\n')) != rest.npos; rest.remove_prefix(end + 1))
    harmless.append(escapedJSON(rest.substr(0, end))).append("\n");
  return harmless.append(escapedJSON(rest));
}

}  // namespace kyt::tools
