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

// The fields of the payload that are of another type than declared, and those that it must have and has not.
inline FieldNames misdeclaredFields(const std::string& source, uint32_t category, uint32_t type,
                                    const Dictionary& payload) {
  using tools::FieldType;
  const auto is = [](const Value& value, FieldType declared) {
    switch (value.kind()) {
      case Value::Kind::string:
        return declared == FieldType::string;
      case Value::Kind::integer:
        return declared == FieldType::integer;
      case Value::Kind::unsignedInteger:
        return declared == FieldType::unsignedInteger;
      case Value::Kind::real:
        return declared == FieldType::number;
      default:
        return false;
    }
  };
  FieldNames names;
  const auto read = tools::readEvents(std::string(KYT_SOURCE_DIR) + "/sources/" + source + "/events.toml");
  const auto* file = std::get_if<tools::EventsFile>(&read);
  if (file == nullptr) return {"the file is wrong"};
  for (const tools::DeclaredEvent& event : file->events) {
    if (event.category != category || event.type != type) continue;
    for (const tools::EventField& field : event.fields) {
      const Value* value = payload.find(field.name);
      if (value == nullptr ? !field.optional : !is(*value, field.type)) names.insert(field.name);
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
