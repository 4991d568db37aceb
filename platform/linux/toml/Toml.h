// TOML text as a tree of plain values that remember their lines, so that every error can say file and line.
// The one seam to the TOML library. Input is hostile: size and depth are limited, and no exception leaves.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt {

struct TomlNode;
using TomlArray = std::vector<TomlNode>;
using TomlTable = std::map<std::string, TomlNode, std::less<>>;

struct TomlNode {
  // std::monostate: a date or a time, which nothing here uses.
  std::variant<std::monostate, std::string, bool, int64_t, double, TomlArray, TomlTable> value;
  uint32_t line = 0;      // where its key stands, from 1; an array's entry: where it begins
  uint32_t lastLine = 0;  // where the value ends

  [[nodiscard]] const std::string* text() const { return std::get_if<std::string>(&value); }
  [[nodiscard]] const TomlArray* array() const { return std::get_if<TomlArray>(&value); }
  [[nodiscard]] const TomlTable* table() const { return std::get_if<TomlTable>(&value); }
  // A text, a truth or a number; none for anything else.
  [[nodiscard]] std::optional<Value> scalar() const;
};

// "file:line: what is wrong", in one line of plain text.
struct TomlError {
  std::string text;
};

inline constexpr size_t kMaxTomlBytes = 4u << 20;

// `name` is what errors call the file.
[[nodiscard]] std::variant<TomlTable, TomlError> parseToml(std::string_view text, std::string_view name);
// Reads and parses; an error too when the file cannot be read or is no regular file ("FILE: No such file or
// directory").
[[nodiscard]] std::variant<TomlTable, TomlError> readToml(const std::string& path);
// The text alone, for parsers that take text.
[[nodiscard]] std::variant<std::string, TomlError> readTomlText(const std::string& path);
[[nodiscard]] TomlError tomlError(std::string_view name, uint32_t line, std::string_view what);

// Text as a TOML basic string, and a key as a bare or quoted key. Precondition: valid UTF-8.
[[nodiscard]] std::string tomlQuoted(std::string_view text);
[[nodiscard]] std::string tomlKey(std::string_view key);

}  // namespace kyt
