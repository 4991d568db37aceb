#include "platform/linux/system/Toml.h"

#include <cstdio>

#include "platform/TextEscape.h"
#include "platform/linux/system/Files.h"

#define TOML_EXCEPTIONS 0
#define TOML_HEADER_ONLY 1
#define TOML_MAX_NESTED_VALUES 16
#include <toml++/toml.h>

namespace kyt {
namespace {

TomlNode converted(const toml::node& node);

TomlTable convertedTable(const toml::table& table) {
  TomlTable result;
  for (auto&& [key, node] : table) {
    TomlNode entry = converted(node);
    if (key.source().begin.line != 0) entry.line = key.source().begin.line;
    result.emplace(std::string(key.str()), std::move(entry));
  }
  return result;
}

TomlNode converted(const toml::node& node) {
  TomlNode result;
  result.line = node.source().begin.line;
  result.lastLine = node.source().end.line;
  if (const auto* text = node.as_string()) {
    result.value = text->get();
  } else if (const auto* boolean = node.as_boolean()) {
    result.value = boolean->get();
  } else if (const auto* integer = node.as_integer()) {
    result.value = static_cast<int64_t>(integer->get());
  } else if (const auto* real = node.as_floating_point()) {
    result.value = real->get();
  } else if (const auto* array = node.as_array()) {
    TomlArray entries;
    entries.reserve(array->size());
    for (const toml::node& entry : *array) entries.push_back(converted(entry));
    result.value = std::move(entries);
  } else if (const auto* table = node.as_table()) {
    result.value = convertedTable(*table);
  }
  return result;
}

// The library recurses over dotted keys without a limit (over nested values it has one, 16 here, and
// each level may hold a dotted key). 600 in a line is far past what a person writes; 16 times that many calls
// fit on the stack.
constexpr size_t kMaxDotsInLine = 600;

// The first line with too many dots, 0 when there is none.
uint32_t lineWithTooManyDots(std::string_view text) {
  uint32_t line = 1;
  size_t dots = 0;
  for (char c : text) {
    if (c == '.' && ++dots > kMaxDotsInLine) return line;
    if (c == '\n') {
      dots = 0;
      ++line;
    }
  }
  return 0;
}

}  // namespace

TomlError tomlError(std::string_view name, uint32_t line, std::string_view what) {
  std::string text = escapedText(name);
  if (line != 0) text += ":" + std::to_string(line);
  text += ": ";
  appendEscaped(text, what);
  return TomlError{std::move(text)};
}

std::variant<TomlTable, TomlError> parseToml(std::string_view text, std::string_view name) {
  if (text.size() > kMaxTomlBytes) return tomlError(name, 0, "the file is too large");
  if (const uint32_t line = lineWithTooManyDots(text); line != 0)
    return tomlError(name, line, "too many dots");
  const toml::parse_result result = toml::parse(text);
  if (result.failed()) {
    return tomlError(name, result.error().source().begin.line, result.error().description());
  }
  return convertedTable(result.table());
}

std::variant<std::string, TomlError> readTomlText(const std::string& path) {
  auto text = readRegularFile(path, kMaxTomlBytes);
  if (const auto* error = std::get_if<std::string>(&text)) return tomlError(path, 0, *error);
  return std::move(std::get<FileContents>(text).bytes);
}

std::variant<TomlTable, TomlError> readToml(const std::string& path) {
  auto text = readTomlText(path);
  if (auto* error = std::get_if<TomlError>(&text)) return std::move(*error);
  return parseToml(std::get<std::string>(text), path);
}

std::string tomlQuoted(std::string_view text) {
  std::string out = "\"";
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (byte < 0x20 || byte == 0x7F) {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\u%04X", byte);
      out += escape;
    } else {
      out += c;
    }
  }
  return out + "\"";
}

std::string tomlKey(std::string_view key) {
  const bool bare = !key.empty() && key.find_first_not_of(
                                        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz"
                                        "0123456789_-") == std::string_view::npos;
  return bare ? std::string(key) : tomlQuoted(key);
}

}  // namespace kyt
