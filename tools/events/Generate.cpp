#include "tools/events/Generate.h"

#include "platform/base/TextEscape.h"

namespace kyt::tools {

std::string eventComment(const DeclaredEvent& event) {
  return event.name + ", category " + std::to_string(event.category) + ", type " +
         std::to_string(event.type) + ": " + event.description;
}

std::string fieldComment(const EventField& field, const std::string& identifier) {
  std::string text = field.personal ? "Personal. " : "";
  if (identifier != field.name) text += "The field \"" + field.name + "\". ";
  return text + field.description;
}

std::string baseNameOf(const EventsFile& file) {
  return escapedText(file.name.substr(file.name.rfind('/') + 1));
}

std::string generateEvents(const EventsFile& file, EventsLanguage language) {
  switch (language) {
    case EventsLanguage::c:
      return generateC(file);
    case EventsLanguage::cxx:
      return generateCxx(file);
    case EventsLanguage::python:
      return generatePython(file);
  }
  return {};
}

}  // namespace kyt::tools
