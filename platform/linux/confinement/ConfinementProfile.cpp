#include "platform/linux/confinement/ConfinementProfile.h"

#include <utility>

namespace kyt {
namespace {

// The path with its variable replaced; empty when it falls away; an error's text as the second.
std::pair<std::string, const char*> expanded(std::string_view entry, const ProfileVariables& variables) {
  std::string path(entry);
  if (entry.starts_with("${")) {
    const size_t end = entry.find('}');
    if (end == std::string_view::npos) return {"", "has a variable without an end"};
    const auto variable = variables.find(entry.substr(2, end - 2));
    if (variable == variables.end()) return {"", "names an unknown variable"};
    if (variable->second.empty()) return {"", nullptr};
    path = variable->second + std::string(entry.substr(end + 1));
  }
  if (!path.starts_with('/') || path.find('\0') != std::string::npos) return {"", "is no absolute path"};
  if (path.find("${") != std::string::npos) return {"", "has a variable in its middle"};
  return {std::move(path), nullptr};
}

// Reads one profile; the first error stays, and what follows it does nothing.
class Parser {
 public:
  Parser(std::string_view name, const ProfileVariables& variables) : name_(name), variables_(variables) {}

  std::variant<ConfinementProfile, TomlError> parse(const TomlTable& table) {
    bool systemCalls = false;
    for (const auto& [key, node] : table) {
      if (key == "read") {
        paths(key, node, profile_.read);
      } else if (key == "write") {
        paths(key, node, profile_.write);
      } else if (key == "folders") {
        paths(key, node, profile_.folders);
      } else if (key == "sockets") {
        paths(key, node, profile_.sockets);
      } else if (key == "limits") {
        if (const TomlTable* limits = section(key, node)) readLimits(*limits);
      } else if (key == "system_calls") {
        systemCalls = true;
        if (const TomlTable* calls = section(key, node)) readSystemCalls(*calls, node.line);
      } else {
        wrong(node.line, "unknown key \"" + key + "\"");
      }
    }
    if (!systemCalls) wrong(0, "the section [system_calls] is missing");
    if (error_) return std::move(*error_);
    return std::move(profile_);
  }

 private:
  void wrong(uint32_t line, const std::string& what) {
    if (!error_) error_ = tomlError(name_, line, what);
  }
  const TomlTable* section(const std::string& key, const TomlNode& node) {
    if (node.table() == nullptr) wrong(node.line, "\"" + key + "\" must be a section");
    return node.table();
  }
  // Calls back with each text of the array and its line.
  template <typename Each>
  void texts(const std::string& key, const TomlNode& node, Each each) {
    const std::string expected = "\"" + key + "\" must be an array of texts";
    if (node.array() == nullptr) return wrong(node.line, expected);
    for (const TomlNode& entry : *node.array()) {
      if (entry.text() == nullptr) return wrong(entry.line, expected);
      each(*entry.text(), entry.line);
    }
  }

  void paths(const std::string& key, const TomlNode& node, std::vector<std::string>& into) {
    texts(key, node, [&](const std::string& entry, uint32_t line) {
      auto [path, problem] = expanded(entry, variables_);
      if (problem != nullptr) wrong(line, "\"" + entry + "\" " + problem);
      if (!path.empty()) into.push_back(std::move(path));
    });
  }

  void readLimits(const TomlTable& table) {
    for (const auto& [key, node] : table) {
      std::optional<uint64_t>* limit = key == "address_space" ? &profile_.limits.addressSpace
                                       : key == "descriptors" ? &profile_.limits.descriptors
                                       : key == "core"        ? &profile_.limits.core
                                                              : nullptr;
      const auto* number = std::get_if<int64_t>(&node.value);
      if (limit == nullptr)
        wrong(node.line, "unknown key \"" + key + "\"");
      else if (number == nullptr || *number < 0)
        wrong(node.line, "\"" + key + "\" must be a number, not less than 0");
      else
        *limit = static_cast<uint64_t>(*number);
    }
  }

  void readSystemCalls(const TomlTable& table, uint32_t line) {
    SystemCallProfile& calls = profile_.systemCalls;
    bool otherwise = false;
    for (const auto& [key, node] : table) {
      if (key == "otherwise") {
        otherwise = true;
        readOtherwise(node);
      } else if (key == "allow") {
        rules(key, node, calls.allow, true);
      } else if (key == "until_listening") {
        rules(key, node, calls.untilListening, false);
      } else if (key == "kill") {
        rules(key, node, calls.kill, false);
      } else if (key == "errors") {
        if (const TomlTable* errors = section(key, node)) readErrors(*errors);
      } else {
        wrong(node.line, "unknown key \"" + key + "\"");
      }
    }
    if (!otherwise) wrong(line, "\"otherwise\" is missing");
  }

  void readOtherwise(const TomlNode& node) {
    const std::string* text = node.text();
    const int error = text != nullptr ? errorNumber(*text) : 0;
    if (error == 0 && (text == nullptr || *text != "kill"))
      return wrong(node.line, "\"otherwise\" must be \"kill\" or the name of an error");
    profile_.systemCalls.otherwise = error == 0 ? kEndsTheProcess : error;
  }

  void readErrors(const TomlTable& table) {
    for (const auto& [key, node] : table) {
      const int error = errorNumber(key);
      if (error == 0) return wrong(node.line, "\"" + key + "\" is no error that a call can fail with here");
      rules(key, node, profile_.systemCalls.errors[error], false);
    }
  }

  void rules(const std::string& list, const TomlNode& node, std::vector<SystemCallRule>& into,
             bool withArguments) {
    texts(list, node, [&](const std::string& entry, uint32_t line) {
      auto parsed = parseSystemCallRule(entry);
      if (const auto* problem = std::get_if<std::string>(&parsed))
        return wrong(line, "\"" + entry + "\" " + *problem);
      auto& rule = std::get<SystemCallRule>(parsed);
      if (!withArguments && !rule.conditions.empty())
        return wrong(line, "\"" + entry + "\" has arguments, which only \"allow\" may have");
      for (const int number : rule.numbers) {
        const auto [place, fresh] = listed_.emplace(number, list);
        if (!fresh && place->second != list)
          return wrong(line, "\"" + entry + "\" stands in \"" + place->second + "\" too");
      }
      into.push_back(std::move(rule));
    });
  }

  const std::string_view name_;
  const ProfileVariables& variables_;
  ConfinementProfile profile_;
  std::map<int, std::string> listed_;  // a call's number: the list that names it
  std::optional<TomlError> error_;
};

}  // namespace

std::variant<ConfinementProfile, TomlError> parseProfile(std::string_view text, std::string_view name,
                                                         const ProfileVariables& variables) {
  auto parsed = parseToml(text, name);
  if (auto* error = std::get_if<TomlError>(&parsed)) return std::move(*error);
  return Parser(name, variables).parse(std::get<TomlTable>(parsed));
}

}  // namespace kyt
