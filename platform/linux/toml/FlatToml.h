// A TOML file without sections: keys with texts, booleans and numbers. User defaults and device.toml are such
// files. Changes are made in the text, so that an administrator's remarks and order survive them.
#pragma once

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/base/Clock.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/toml/Toml.h"
#include "platform/objects/Value.h"

namespace kyt {

struct FlatTomlEntry {
  Value value;
  uint32_t line = 0, lastLine = 0;
};

struct FlatToml {
  std::string text;
  std::map<std::string, FlatTomlEntry, std::less<>> entries;

  [[nodiscard]] Value value(std::string_view key) const;
  [[nodiscard]] size_t countWithPrefix(std::string_view prefix) const;
  // The text with that key set, or without it when the value is null. Nothing when the key or the value
  // cannot stand in such a file (another kind of value, an unsigned number past 2^63-1, invalid UTF-8) or the
  // text would be too large.
  [[nodiscard]] std::optional<std::string> textWith(std::string_view key, const Value& value) const;
  // The text without the entries whose keys begin so.
  [[nodiscard]] std::string textWithoutPrefix(std::string_view prefix) const;
};

// An error when there is a section, an array or a date: nothing could be answered for those.
[[nodiscard]] std::variant<FlatToml, TomlError> parseFlatToml(std::string_view text, std::string_view name);

// Such a file, read again when it has changed. Not safe for concurrent calls: its owner locks.
//
// A file that the machine cannot read at the moment (no descriptor, no memory) keeps what was read before, since the
// failure says nothing about the file; it is tried again at every access.
class FlatTomlFile {
 public:
  FlatTomlFile(std::string path, const Clock& clock) : path_(std::move(path)), clock_(clock) {}
  // What the file holds now: nothing when it is missing, bad or may not be read. `problem` is set once for each state of
  // a bad file, and once a minute while a file cannot be read.
  [[nodiscard]] const FlatToml& current(std::optional<TomlError>& problem);

 private:
  static constexpr Duration kToldAgainAfter = std::chrono::minutes(1);
  void couldNotRead(int error, const std::string& text, std::optional<TomlError>& problem);

  const std::string path_;
  const Clock& clock_;
  FileIdentity identity_;  // of what was read last
  FileIdentity reported_;  // of the state whose problem was told
  bool certain_ = false;   // nothing can have changed without changing the identity
  int readError_ = 0;      // told last, at …
  MonotonicTime toldReadError_;
  FlatToml content_;
};

}  // namespace kyt
