// Property lists: the storebag's two layers. What was read is written to something that reads back, and from
// the second time on the same: the first time control characters become U+FFFD, and keys may so become equal.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "platform/linux/data/PugixmlPropertyLists.h"

namespace {

std::string writtenAgain(kyt::PugixmlPropertyLists& lists, const std::string& text) {
  const auto read = lists.parse(text);
  if (!std::holds_alternative<kyt::Value>(read)) std::abort();
  return lists.serialize(std::get<kyt::Value>(read));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  kyt::PugixmlPropertyLists lists;
  const auto read = lists.parse({reinterpret_cast<const char*>(data), size});
  if (const auto* error = std::get_if<kyt::Error>(&read)) {
    if (error->localizedDescription.empty()) std::abort();
    return 0;
  }
  const std::string second = writtenAgain(lists, lists.serialize(std::get<kyt::Value>(read)));
  if (writtenAgain(lists, second) != second) std::abort();
  return 0;
}
