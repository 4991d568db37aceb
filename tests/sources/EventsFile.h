// What a source's events.toml says that it reports.
#pragma once

#include <set>
#include <string>
#include <utility>
#include <variant>

#include "platform/linux/toml/Toml.h"

namespace kyt {

using FieldNames = std::set<std::string>;

// The fields of the event with these numbers; none where there is no such event. Personal fields count as "personal!".
inline FieldNames declaredFields(const std::string& source, uint32_t category, uint32_t type) {
  FieldNames names;
  const auto read = readToml(std::string(KYT_SOURCE_DIR) + "/sources/" + source + "/events.toml");
  const auto* table = std::get_if<TomlTable>(&read);
  if (table == nullptr || !table->contains("event")) return names;
  for (const TomlNode& event : *table->at("event").array()) {
    const TomlTable& entry = *event.table();
    if (std::get<int64_t>(entry.at("category").value) != category ||
        std::get<int64_t>(entry.at("type").value) != type)
      continue;
    for (const auto& [name, field] : *entry.at("fields").table()) {
      names.insert(name);
      if (std::get<bool>(field.table()->at("personal").value)) names.insert("personal!");
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
