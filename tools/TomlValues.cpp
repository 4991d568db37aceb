#include "tools/TomlValues.h"

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "platform/linux/toml/Toml.h"

namespace kyt::tools {

namespace {

Value converted(const TomlNode& node);

Dictionary convertedTable(const TomlTable& table) {
  // By line, since that is the order in which their author thinks of them; within a line by name.
  std::vector<std::pair<const std::string*, const TomlNode*>> entries;
  for (const auto& [key, node] : table) entries.emplace_back(&key, &node);
  std::stable_sort(entries.begin(), entries.end(),
                   [](const auto& a, const auto& b) { return a.second->line < b.second->line; });
  Dictionary out;
  for (const auto& [key, node] : entries) out.set(String(*key), converted(*node));
  return out;
}

Value converted(const TomlNode& node) {
  if (const TomlTable* table = node.table()) return convertedTable(*table);
  if (const TomlArray* array = node.array()) {
    Array out;
    for (const TomlNode& element : *array) out.append(converted(element));
    return out;
  }
  return node.scalar().value_or(Value());  // null for a date or a time: bags have none
}

}  // namespace

std::variant<Value, Error> parseToml(std::string_view text) {
  auto parsed = kyt::parseToml(text, "bag");
  if (const auto* error = std::get_if<TomlError>(&parsed))
    return Error{"KYTToolsErrorDomain", -1, error->text};
  return Value(convertedTable(std::get<TomlTable>(parsed)));
}

}  // namespace kyt::tools
