#include "tools/TomlValues.h"

#include <algorithm>
#include <ctime>
#include <string>
#include <vector>
// After the standard headers: the parser is header-only, and this is the only file of the tools that pays for
// it.
#include <toml++/toml.h>

namespace kyt::tools {

namespace {

Value converted(const toml::node& node);

double seconds(const toml::date_time& value) {
  std::tm parts{};
  parts.tm_year = value.date.year - 1900;
  parts.tm_mon = value.date.month - 1;
  parts.tm_mday = value.date.day;
  parts.tm_hour = value.time.hour;
  parts.tm_min = value.time.minute;
  parts.tm_sec = value.time.second;
  const double offset = value.offset ? value.offset->minutes * 60.0 : 0.0;
  return static_cast<double>(timegm(&parts)) - offset + value.time.nanosecond / 1e9;
}

Dictionary convertedTable(const toml::table& table) {
  // The parser sorts its keys; where they stand in the text is still known.
  std::vector<std::pair<const toml::key*, const toml::node*>> entries;
  for (const auto& [key, node] : table) entries.emplace_back(&key, &node);
  std::stable_sort(entries.begin(), entries.end(), [](const auto& a, const auto& b) {
    return a.first->source().begin < b.first->source().begin;
  });
  Dictionary out;
  for (const auto& [key, node] : entries) out.set(String(key->str()), converted(*node));
  return out;
}

Value converted(const toml::node& node) {
  if (const auto* table = node.as_table()) return convertedTable(*table);
  if (const auto* array = node.as_array()) {
    Array out;
    for (const toml::node& element : *array) out.append(converted(element));
    return out;
  }
  if (const auto* text = node.as_string()) return Value(text->get());
  if (const auto* integer = node.as_integer()) return Value(static_cast<long long>(integer->get()));
  if (const auto* number = node.as_floating_point()) return Value(number->get());
  if (const auto* boolean = node.as_boolean()) return Value(boolean->get());
  if (const auto* date = node.as_date_time()) return Value(Date{seconds(date->get())});
  return Value();
}

}  // namespace

std::variant<Value, Error> parseToml(std::string_view text) {
  try {
    return Value(convertedTable(toml::parse(text)));
  } catch (const toml::parse_error& error) {
    const auto& at = error.source().begin;
    return Error{"KYTToolsErrorDomain", -1,
                 "line " + std::to_string(at.line) + ", column " + std::to_string(at.column) + ": " +
                     std::string(error.description())};
  }
}

}  // namespace kyt::tools
