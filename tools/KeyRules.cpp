#include "tools/KeyRules.h"

#include <algorithm>

namespace kyt::tools {
namespace {

std::string quoted(std::string_view name) {
  return "\"" + std::string(name) + "\"";
}

std::string namesOf(std::span<const KeyRule> rules) {
  std::string names;
  for (const KeyRule& rule : rules) names += (names.empty() ? "" : ", ") + std::string(rule.name);
  return names.empty() ? "there are none" : "there are " + names;
}

bool isBetween(const Value& value, const KeyRule& rule) {
  if (value.kind() == Value::Kind::integer)
    return value.longLongValue() >= rule.least && value.longLongValue() <= rule.most;
  return value.kind() == Value::Kind::unsignedInteger && value.longLongValue() >= rule.least &&
         value.longLongValue() <= rule.most;
}

// "must be …", or none.
std::optional<std::string> problemOf(const Value& value, const KeyRule& rule) {
  switch (rule.kind) {
    case KeyKind::boolean:
      if (value.kind() == Value::Kind::boolean) return std::nullopt;
      return "must be true or false";
    case KeyKind::number:
      if (isBetween(value, rule)) return std::nullopt;
      return "must be a whole number from " + std::to_string(rule.least) + " to " + std::to_string(rule.most);
    case KeyKind::real:
      if (value.isNumber() && value.kind() != Value::Kind::boolean) return std::nullopt;
      return "must be a number";
    case KeyKind::text:
      if (value.isString()) return std::nullopt;
      return "must be text";
    case KeyKind::object:
      if (value.isDictionary()) return std::nullopt;
      return "must be an object";
  }
  return std::nullopt;
}

}  // namespace

std::optional<std::string> problemIn(const Dictionary& object, std::span<const KeyRule> rules) {
  for (const DictionaryEntry& entry : object) {
    const auto rule = std::find_if(rules.begin(), rules.end(), [&entry](const KeyRule& candidate) {
      return candidate.name == entry.key.view();
    });
    if (rule == rules.end()) return "unknown key " + quoted(entry.key.view()) + "; " + namesOf(rules);
    if (auto problem = problemOf(entry.value, *rule)) return quoted(rule->name) + " " + *problem;
  }
  for (const KeyRule& rule : rules)
    if (rule.required && object.find(rule.name) == nullptr) return quoted(rule.name) + " is missing";
  return std::nullopt;
}

}  // namespace kyt::tools
