#include "tools/events/EventsFile.h"

#include <algorithm>
#include <array>
#include <map>
#include <optional>
#include <utility>

#include "platform/base/NearestName.h"
#include "platform/base/TextEscape.h"

namespace kyt::tools {

namespace {

const std::array<std::string, 9> kTypes = {"string", "integer", "unsigned", "number",    "boolean",
                                           "date",   "data",    "array",    "dictionary"};
const std::array<std::string, 3> kFileKeys = {"client", "service", "event"};
const std::array<std::string, 5> kEventKeys = {"event", "category", "type", "description", "fields"};
const std::array<std::string, 4> kFieldKeys = {"type", "personal", "optional", "description"};

std::string quoted(std::string_view name) {
  return "\"" + std::string(name) + "\"";
}

// The entries in the order in which their author wrote them; within a line by name.
std::vector<std::pair<const std::string*, const TomlNode*>> entriesOf(const TomlTable& table) {
  std::vector<std::pair<const std::string*, const TomlNode*>> entries;
  for (const auto& [key, node] : table) entries.emplace_back(&key, &node);
  std::stable_sort(entries.begin(), entries.end(),
                   [](const auto& a, const auto& b) { return a.second->line < b.second->line; });
  return entries;
}

std::string withoutCarriageReturns(const std::string& text) {
  std::string out;
  for (size_t at = 0; at < text.size(); ++at)
    if (text[at] != '\r' || at + 1 == text.size() || text[at + 1] != '\n') out += text[at];
  return out;
}

// But for its line breaks and tabs.
bool isPlainDescription(const std::string& text) {
  std::string rest = text;
  std::erase_if(rest, [](char c) { return c == '\n' || c == '\t'; });
  return isPlainText(rest);
}

class EventsReader {
 public:
  explicit EventsReader(std::string_view name) { file_.name = name; }

  void read(const TomlTable& table) {
    checkKeys(table, kFileKeys, "", 0);
    readNameAt(table, "client", "", file_.client);
    readNameAt(table, "service", "", file_.service);
    for (const char* key : {"service", "client"})
      if (const auto at = table.find(key); at != table.end()) file_.clientLine = at->second.line;
    const auto events = table.find("event");
    if (events == table.end()) return problem(0, "there is no [[event]]");
    const TomlArray* array = events->second.array();
    if (array == nullptr || array->empty())
      return problem(events->second.line, "\"event\" must be written as [[event]]");
    if (array->size() > kMostEvents)
      return problem((*array)[kMostEvents].line,
                     "there are more than " + std::to_string(kMostEvents) + " events");
    for (const TomlNode& node : *array) readEvent(node);
  }

  [[nodiscard]] std::variant<EventsFile, EventsProblems> result() && {
    if (problems_.empty()) return std::move(file_);
    std::stable_sort(problems_.begin(), problems_.end(),
                     [](const auto& a, const auto& b) { return a.first < b.first; });
    EventsProblems told;
    for (const auto& [line, what] : problems_) {
      if (told.size() == kMostProblemsOfEvents) {
        told.push_back(tomlError(file_.name, 0,
                                 "and " + std::to_string(problems_.size() - told.size()) + " more problems"));
        break;
      }
      told.push_back(tomlError(file_.name, line, what));
    }
    return told;
  }

 private:
  void problem(uint32_t line, std::string what) { problems_.emplace_back(line, std::move(what)); }

  // `where` is in front of a key in problems: "fields.unit.".
  void checkKeys(const TomlTable& table, std::span<const std::string> known, const std::string& where,
                 uint32_t line) {
    for (const auto& [key, node] : table) {
      if (std::find(known.begin(), known.end(), key) != known.end()) continue;
      const std::optional<std::string> nearest = nearestName(key, known);
      problem(node.line != 0 ? node.line : line,
              "unknown key " + quoted(where + key) +
                  (nearest ? "; the nearest known one is " + quoted(where + *nearest) : ""));
    }
  }

  // Null where it is missing or of another kind, which is a problem then.
  template <typename T>
  const T* required(const TomlTable& table, const char* key, const std::string& where, uint32_t line,
                    const char* what) {
    const auto at = table.find(key);
    if (at == table.end()) {
      problem(line, quoted(where + key) + " is missing");
      return nullptr;
    }
    const T* value = std::get_if<T>(&at->second.value);
    if (value == nullptr) problem(at->second.line, quoted(where + key) + " must be " + what);
    return value;
  }

  [[nodiscard]] static std::string wrongName(const std::string& name) {
    if (name.empty()) return "must not be empty";
    if (name.size() > kLongestEventName)
      return "must have at most " + std::to_string(kLongestEventName) + " bytes";
    return isPlainText(name) ? ""
                             : "must be plain text, without control characters and marks that reorder it";
  }

  void readNameAt(const TomlTable& table, const char* key, const std::string& where, std::string& out) {
    const auto at = table.find(key);
    if (at == table.end()) return;
    const std::string* text = at->second.text();
    const std::string wrong = text != nullptr ? wrongName(*text) : "must be text";
    if (!wrong.empty()) return problem(at->second.line, quoted(where + key) + " " + wrong);
    out = *text;
  }

  void readDescription(const TomlTable& table, const std::string& where, uint32_t line, std::string& out) {
    const auto* text = required<std::string>(table, "description", where, line, "text");
    if (text == nullptr) return;
    out = withoutCarriageReturns(*text);
    const uint32_t at = table.find("description")->second.line;
    if (out.find_first_not_of(" \t\n") == std::string::npos)
      problem(at, quoted(where + "description") + " must not be empty");
    else if (out.size() > kLongestDescription)
      problem(at, quoted(where + "description") + " must have at most " +
                      std::to_string(kLongestDescription) + " bytes");
    else if (!isPlainDescription(out))
      problem(at, quoted(where + "description") +
                      " must be plain text, without control characters and marks that reorder it");
  }

  void readNumber(const TomlTable& table, const char* key, uint32_t line, uint16_t& out) {
    const auto* number = required<int64_t>(table, key, "", line, "a whole number from 0 to 65535");
    if (number == nullptr) return;
    if (*number < 0 || *number > UINT16_MAX)
      return problem(table.find(key)->second.line, quoted(key) + " must be a whole number from 0 to 65535");
    out = static_cast<uint16_t>(*number);
  }

  void readEvent(const TomlNode& node) {
    const TomlTable* table = node.table();
    if (table == nullptr) return problem(node.line, "\"event\" must be written as [[event]]");
    const size_t before = problems_.size();
    DeclaredEvent event;
    event.line = node.line;
    checkKeys(*table, kEventKeys, "", node.line);
    if (table->contains("event"))
      readNameAt(*table, "event", "", event.name);
    else
      problem(node.line, "\"event\", the event's name, is missing");
    readNumber(*table, "category", node.line, event.category);
    readNumber(*table, "type", node.line, event.type);
    readDescription(*table, "", node.line, event.description);
    readFields(*table, event);
    if (problems_.size() != before) return;
    checkUnique(event);
    file_.events.push_back(std::move(event));
  }

  void checkUnique(const DeclaredEvent& event) {
    const auto [name, isNewName] = lineOfName_.emplace(event.name, event.line);
    if (!isNewName)
      problem(event.line, "the event of line " + std::to_string(name->second) + " has the name " +
                              quoted(event.name) + " already");
    const auto [numbers, areNew] = lineOfNumbers_.emplace(std::pair(event.category, event.type), event.line);
    if (!areNew)
      problem(event.line, "the event of line " + std::to_string(numbers->second) + " has category " +
                              std::to_string(event.category) + " and type " + std::to_string(event.type) +
                              " already");
  }

  void readFields(const TomlTable& table, DeclaredEvent& event) {
    const auto at = table.find("fields");
    if (at == table.end()) return;
    const TomlTable* fields = at->second.table();
    if (fields == nullptr) return problem(at->second.line, "\"fields\" must be a table, a field each");
    if (fields->size() > kMostFields)
      return problem(at->second.line, "there are more than " + std::to_string(kMostFields) + " fields");
    for (const auto& [name, node] : entriesOf(*fields)) readField(*name, *node, event);
  }

  void readField(const std::string& name, const TomlNode& node, DeclaredEvent& event) {
    const std::string where = "fields." + name + ".";
    if (const std::string wrong = wrongName(name); !wrong.empty())
      return problem(node.line, "a field's name " + wrong);
    const TomlTable* table = node.table();
    if (table == nullptr)
      return problem(node.line, quoted("fields." + name) +
                                    " must be a table: { type = \"string\", personal = false, "
                                    "description = \"…\" }");
    EventField field;
    field.name = name;
    field.line = node.line;
    checkKeys(*table, kFieldKeys, where, node.line);
    readType(*table, where, node.line, field.type);
    if (const auto* personal = required<bool>(*table, "personal", where, node.line, "true or false"))
      field.personal = *personal;
    if (table->contains("optional"))
      if (const auto* optional = required<bool>(*table, "optional", where, node.line, "true or false"))
        field.optional = *optional;
    readDescription(*table, where, node.line, field.description);
    event.fields.push_back(std::move(field));
  }

  void readType(const TomlTable& table, const std::string& where, uint32_t line, FieldType& out) {
    const auto* text = required<std::string>(table, "type", where, line, "text");
    if (text == nullptr) return;
    const auto at = std::find(kTypes.begin(), kTypes.end(), *text);
    if (at != kTypes.end()) {
      out = static_cast<FieldType>(at - kTypes.begin());
      return;
    }
    std::string names;
    for (const std::string& type : kTypes) names += (names.empty() ? "" : ", ") + type;
    const std::optional<std::string> nearest = nearestName(*text, kTypes);
    problem(table.find("type")->second.line, quoted(where + "type") + " must be one of " + names +
                                                 (nearest ? "; the nearest one is " + quoted(*nearest) : ""));
  }

  EventsFile file_;
  std::vector<std::pair<uint32_t, std::string>> problems_;  // with their lines; 0: the whole file's
  std::map<std::string, uint32_t> lineOfName_;
  std::map<std::pair<uint16_t, uint16_t>, uint32_t> lineOfNumbers_;
};

}  // namespace

const std::string& fieldTypeName(FieldType type) {
  return kTypes[static_cast<size_t>(type)];
}

std::variant<EventsFile, EventsProblems> parseEvents(std::string_view text, std::string_view name) {
  const auto parsed = parseToml(text, name);
  if (const auto* error = std::get_if<TomlError>(&parsed)) return EventsProblems{*error};
  EventsReader reader(name);
  reader.read(std::get<TomlTable>(parsed));
  return std::move(reader).result();
}

std::variant<EventsFile, EventsProblems> readEvents(const std::string& path) {
  const auto text = readTomlText(path);
  if (const auto* error = std::get_if<TomlError>(&text)) return EventsProblems{*error};
  return parseEvents(std::get<std::string>(text), path);
}

const EventKeys& eventKeys() {
  static const EventKeys keys{kFileKeys, kEventKeys, kFieldKeys, kTypes};
  return keys;
}

}  // namespace kyt::tools
