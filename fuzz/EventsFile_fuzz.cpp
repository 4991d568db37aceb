// What programs say that they report (events.toml). What is checked besides memory: errors are plain lines that begin with
// the file's name, a file that is taken keeps its bounds and has no event twice, comparing it with a storebag tells
// findings of plain text, and what is made of it is UTF-8.
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "platform/base/TextEscape.h"
#include "tools/events/Document.h"
#include "tools/events/EventsCheck.h"
#include "tools/events/EventsFile.h"
#include "tools/events/Generate.h"

namespace kyt::tools {
namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

const Dictionary& bag() {
  static const Array filters{Dictionary{{"key", "a"}, {"action", "remove"}},
                             Dictionary{{"key", "b"}, {"action", "sha256"}, {"method", 1}}};
  static const Dictionary bag{
      {"release",
       Dictionary{
           {"httppost", Dictionary{{"clients", Array{Dictionary{{"client", "c"}, {"service", "s"}},
                                                     Dictionary{{"filters", filters},
                                                                {"event_whitelist", Array{0, 1}}}}}}}}}};
  return bag;
}

void check(const EventsFile& file) {
  require(!file.events.empty() && file.events.size() <= kMostEvents);
  std::set<std::pair<uint16_t, uint16_t>> numbers;
  std::set<std::string> names;
  for (const DeclaredEvent& event : file.events) {
    require(isPlainText(event.name) && !event.name.empty() && event.name.size() <= kLongestEventName);
    require(names.insert(event.name).second && numbers.emplace(event.category, event.type).second);
    require(event.fields.size() <= kMostFields && event.description.size() <= kLongestDescription);
    std::set<std::string> fields;
    for (const EventField& field : event.fields)
      require(isPlainText(field.name) && fields.insert(field.name).second);
  }
  for (const EventsLanguage language : {EventsLanguage::c, EventsLanguage::cxx, EventsLanguage::python})
    require(isValidUTF8(generateEvents(file, language)));
  require(isValidUTF8(documentEvents(file)));
  for (const EventFinding& finding : checkEvents(file, bag()).findings) require(isPlainText(finding.text));
}

}  // namespace
}  // namespace kyt::tools

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace kyt::tools;
  const auto read = parseEvents({reinterpret_cast<const char*>(data), size}, "e.toml");
  if (const auto* problems = std::get_if<EventsProblems>(&read)) {
    require(!problems->empty());
    for (const kyt::TomlError& problem : *problems)
      require(problem.text.starts_with("e.toml") && kyt::isPlainText(problem.text));
  } else {
    check(std::get<EventsFile>(read));
  }
  return 0;
}
