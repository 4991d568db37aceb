// What a source's events.toml says that it reports.
#pragma once

#include <set>
#include <string>
#include <utility>
#include <variant>

#include "platform/objects/Value.h"
#include "tools/events/EventsFile.h"

namespace kyt {

using FieldNames = std::set<std::string>;

// The fields of the event with these numbers; none where there is no such event. Personal fields count as "personal!".
inline FieldNames declaredFields(const std::string& source, uint32_t category, uint32_t type) {
  FieldNames names;
  const auto read = tools::readEvents(std::string(KYT_SOURCE_DIR) + "/sources/" + source + "/events.toml");
  const auto* file = std::get_if<tools::EventsFile>(&read);
  if (file == nullptr) return names;
  for (const tools::DeclaredEvent& event : file->events) {
    if (event.category != category || event.type != type) continue;
    for (const tools::EventField& field : event.fields) {
      names.insert(field.name);
      if (field.personal) names.insert("personal!");
    }
  }
  return names;
}

inline FieldNames fieldsOf(const Dictionary& payload) {
  FieldNames names;
  for (const auto& [key, value] : payload) names.insert(key.str());
  return names;
}

}  // namespace kyt
