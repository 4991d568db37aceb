// JSON texts. What is read must be written to something that reads back equal, and laid out as the writer does.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "platform/base/JSONLayout.h"
#include "platform/linux/data/RapidJSON.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  kyt::RapidJSON json;
  const auto read = json.parse({reinterpret_cast<const char*>(data), size});
  const auto* value = std::get_if<kyt::Value>(&read);
  if (value == nullptr) return 0;
  std::string compact;
  std::string pretty;
  json.writeCompact(*value, compact);
  json.writePretty(*value, pretty);
  for (const std::string& text : {compact, pretty}) {
    const auto again = json.parse(text);
    if (!std::holds_alternative<kyt::Value>(again) || !(std::get<kyt::Value>(again) == *value)) std::abort();
  }
  std::string laidOut;
  kyt::appendLaidOutJSON(laidOut, compact);
  if (laidOut != pretty) std::abort();
  return 0;
}
