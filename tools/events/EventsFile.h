// events.toml: the events that a program reports, each with its numbers, its fields and what they mean, in one place. Read
// here, strictly, for `kytctl events` and for tests: a key that is silently ignored would be a promise that nobody keeps.
// One thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/linux/toml/Toml.h"

namespace kyt::tools {

// What a field holds: "string", "integer" (64 bits with a sign), "unsigned" (64 bits without), "number" (a double),
// "boolean", "date", "data" (bytes), "array", "dictionary".
enum class FieldType : uint8_t {
  string,
  integer,
  unsignedInteger,
  number,
  boolean,
  date,
  data,
  array,
  dictionary
};
[[nodiscard]] const std::string& fieldTypeName(FieldType type);

struct EventField {
  std::string name;  // its key in the payload
  FieldType type = FieldType::string;
  bool personal = false;  // tells something about a person
  bool optional = false;  // an event may be without it
  std::string description;
  uint32_t line = 0;
};

struct DeclaredEvent {
  std::string name;
  uint16_t category = 0, type = 0;
  std::string description;
  std::vector<EventField> fields;  // in the file's order
  uint32_t line = 0;
};

// What is read of it has bounds, so that what is made of it has some too: each is far past what a program that people
// review would have. Names are of plain text (TextEscape.h), descriptions too but for line breaks and tabs.
inline constexpr size_t kMostEvents = 10'000;
inline constexpr size_t kMostFields = 256;            // of one event
inline constexpr size_t kLongestEventName = 128;      // bytes, of events, fields, client and service
inline constexpr size_t kLongestDescription = 4096;   // bytes
inline constexpr size_t kMostProblemsOfEvents = 100;  // told of one file; then how many more

struct EventsFile {
  std::string name;             // of the file, as findings have it
  std::string client, service;  // "ClientName" and "ServiceName" of the program's sessions; empty: not said
  uint32_t clientLine = 0;      // where they stand
  std::vector<DeclaredEvent>
      events;  // in the file's order; no two with one name, no two with one category and type
};

// All that is wrong, in the order of its lines, each "file:line: what", in one line of plain text.
using EventsProblems = std::vector<TomlError>;

// `name` is what problems call the file.
[[nodiscard]] std::variant<EventsFile, EventsProblems> parseEvents(std::string_view text,
                                                                   std::string_view name);
[[nodiscard]] std::variant<EventsFile, EventsProblems> readEvents(const std::string& path);

// All keys that there are, of the file, of an event and of a field: what documentation is compared with.
struct EventKeys {
  std::span<const std::string> ofFile, ofEvent, ofField, types;
};
[[nodiscard]] const EventKeys& eventKeys();

}  // namespace kyt::tools
