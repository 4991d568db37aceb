#include "platform/linux/data/PugixmlPropertyLists.h"

#include <algorithm>
#include <charconv>
#include <chrono>
#include <optional>
#include <pugixml.hpp>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/Base64.h"

namespace kyt {
namespace {

using pugi::xml_node;

constexpr std::string_view kBlanks = " \t\r\n";

std::string_view trimmed(std::string_view text) {
  const size_t first = text.find_first_not_of(kBlanks);
  if (first == text.npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

bool isText(const xml_node& node) {
  return node.type() == pugi::node_pcdata || node.type() == pugi::node_cdata;
}

template <typename Number>
std::optional<Number> wholeNumber(std::string_view text, int base) {
  Number number{};
  const auto result = std::from_chars(text.data(), text.data() + text.size(), number, base);
  if (result.ec != std::errc() || result.ptr != text.data() + text.size()) return std::nullopt;
  return number;
}

std::optional<Value> integerOf(std::string_view text) {
  text = trimmed(text);
  bool negative = false;
  if (!text.empty() && (text.front() == '-' || text.front() == '+')) {
    negative = text.front() == '-';
    text.remove_prefix(1);
  }
  int base = 10;
  if (text.starts_with("0x") || text.starts_with("0X")) {
    base = 16;
    text.remove_prefix(2);
  }
  const auto magnitude = wholeNumber<uint64_t>(text, base);  // takes no sign, being unsigned
  if (!magnitude) return std::nullopt;
  constexpr uint64_t kMost = INT64_MAX;
  if (negative) {
    if (*magnitude > kMost + 1) return std::nullopt;
    return Value(static_cast<int64_t>(0 - *magnitude));
  }
  return *magnitude <= kMost ? Value(static_cast<int64_t>(*magnitude)) : Value(*magnitude);
}

std::optional<Value> realOf(std::string_view text) {
  text = trimmed(text);
  if (text.starts_with('+')) {
    text.remove_prefix(1);
    if (text.starts_with('-')) return std::nullopt;
  }
  double number = 0;
  const auto result = std::from_chars(text.data(), text.data() + text.size(), number);
  if (result.ec != std::errc() || result.ptr != text.data() + text.size()) return std::nullopt;
  return Value(number);
}

// "2026-01-31T12:00:00Z", nothing else.
std::optional<Value> dateOf(std::string_view text) {
  text = trimmed(text);
  constexpr std::string_view kPattern = "0000-00-00T00:00:00Z";
  if (text.size() != kPattern.size()) return std::nullopt;
  for (size_t i = 0; i < text.size(); ++i) {
    const bool digit = text[i] >= '0' && text[i] <= '9';
    if (kPattern[i] == '0' ? !digit : text[i] != kPattern[i]) return std::nullopt;
  }
  const auto part = [text](size_t at, size_t length) {
    return *wholeNumber<unsigned>(text.substr(at, length), 10);
  };
  using namespace std::chrono;
  const year_month_day day{year(static_cast<int>(part(0, 4))), month(part(5, 2)),
                           std::chrono::day(part(8, 2))};
  if (!day.ok() || part(11, 2) > 23 || part(14, 2) > 59 || part(17, 2) > 59) return std::nullopt;
  const auto time = sys_days(day) + hours(part(11, 2)) + minutes(part(14, 2)) + seconds(part(17, 2));
  return Value(Date{static_cast<double>(duration_cast<seconds>(time.time_since_epoch()).count())});
}

// Turns the elements of a document into objects; the first thing that is wrong ends it.
class Reader {
 public:
  [[nodiscard]] std::optional<Value> root(const xml_node& document) {
    const auto list = onlyElement(document, "The document");
    if (!list) return std::nullopt;
    if (nameOf(*list) != "plist") return wrong(*list, "The root element is not \"plist\"");
    const auto element = onlyElement(*list, "The element \"plist\"");
    if (!element) return std::nullopt;
    return object(*element, 1);
  }
  [[nodiscard]] const std::string& error() const { return error_; }

 private:
  static std::string_view nameOf(const xml_node& node) { return node.name(); }

  std::nullopt_t wrong(const xml_node& node, std::string what) {
    error_ = std::move(what) + " (offset " + std::to_string(node.offset_debug()) + ")";
    return std::nullopt;
  }

  // Blanks between elements; any other text there is an error.
  static bool isBlank(const xml_node& node) { return isText(node) && trimmed(node.value()).empty(); }

  std::optional<xml_node> onlyElement(const xml_node& parent, const char* what) {
    std::optional<xml_node> found;
    for (const xml_node& child : parent.children()) {
      if (isBlank(child)) continue;
      if (isText(child) || found)
        return wrong(child, std::string(what) + " does not hold exactly one element");
      found = child;
    }
    if (!found) return wrong(parent, std::string(what) + " is empty");
    return found;
  }

  // All text of an element that holds nothing else; comments and CDATA sections may have cut it into pieces.
  std::optional<std::string> text(const xml_node& node) {
    std::string all;
    for (const xml_node& child : node.children()) {
      if (!isText(child))
        return wrong(child, "The element \"" + std::string(nameOf(node)) + "\" holds another element");
      all += child.value();
    }
    if (!isValidUTF8(all)) return wrong(node, "The text is not valid UTF-8");
    return all;
  }

  std::optional<Value> object(const xml_node& node, int depth) {
    const std::string_view name = nameOf(node);
    if (name == "dict" || name == "array") {
      if (depth > Limits::maxObjectDepth) return wrong(node, "Containers are nested too deep");
      return name == "dict" ? dictionary(node, depth) : array(node, depth);
    }
    const bool known = name == "string" || name == "integer" || name == "real" || name == "date" ||
                       name == "data" || name == "true" || name == "false";
    if (!known) return wrong(node, "An unknown element");
    const auto content = text(node);
    if (!content) return std::nullopt;
    std::optional<Value> value = leaf(name, *content);
    if (!value) return wrong(node, "The element \"" + std::string(name) + "\" holds no such value");
    return value;
  }

  static std::optional<Value> leaf(std::string_view name, const std::string& content) {
    if (name == "string") return Value(content);
    if (name == "integer") return integerOf(content);
    if (name == "real") return realOf(content);
    if (name == "date") return dateOf(content);
    if (name == "data") {
      auto data = base64Decode(content);
      if (!data) return std::nullopt;
      return Value(*std::move(data));
    }
    if (!trimmed(content).empty()) return std::nullopt;
    return Value(name == "true");
  }

  std::optional<Value> dictionary(const xml_node& node, int depth) {
    Dictionary entries;
    std::optional<String> key;
    for (const xml_node& child : node.children()) {
      if (isBlank(child)) continue;
      if (isText(child)) return wrong(child, "Text among the elements of a dictionary");
      if (!key) {
        if (nameOf(child) != "key") return wrong(child, "A key is missing");
        const auto content = text(child);
        if (!content) return std::nullopt;
        key = String(*content);
        continue;
      }
      if (nameOf(child) == "key") return wrong(child, "A value is missing");
      auto value = object(child, depth + 1);
      if (!value) return std::nullopt;
      entries.set(*std::exchange(key, std::nullopt), *std::move(value));
    }
    if (key) return wrong(node, "The last key of a dictionary has no value");
    return Value(std::move(entries));
  }

  std::optional<Value> array(const xml_node& node, int depth) {
    Array elements;
    for (const xml_node& child : node.children()) {
      if (isBlank(child)) continue;
      if (isText(child)) return wrong(child, "Text among the elements of an array");
      auto value = object(child, depth + 1);
      if (!value) return std::nullopt;
      elements.append(*std::move(value));
    }
    return Value(std::move(elements));
  }

  std::string error_;
};

Error failure(int code, std::string what) {
  return {kPropertyListErrorDomain, code, std::move(what)};
}

}  // namespace

std::variant<Value, Error> PugixmlPropertyLists::parse(std::string_view bytes) {
  if (bytes.size() > Limits::maxHTTPReplyBytes) return failure(-1, "The property list is too long");
  if (static_cast<size_t>(std::count(bytes.begin(), bytes.end(), '<')) > Limits::maxPropertyListTags)
    return failure(-1, "The property list has too many tags");
  // The parser takes a NUL for the end of the text.
  if (const size_t zero = bytes.find('\0'); zero != bytes.npos)
    return failure(-1, "A NUL character (offset " + std::to_string(zero) + ")");
  constexpr unsigned kOptions = pugi::parse_escapes | pugi::parse_eol | pugi::parse_cdata |
                                pugi::parse_ws_pcdata;  // and nothing else is kept
  pugi::xml_document document;
  const pugi::xml_parse_result result =
      document.load_buffer(bytes.data(), bytes.size(), kOptions, pugi::encoding_utf8);
  if (!result)
    return failure(result.status,
                   std::string(result.description()) + " (offset " + std::to_string(result.offset) + ")");
  Reader reader;
  if (auto value = reader.root(document)) return *std::move(value);
  return failure(-1, reader.error());
}

}  // namespace kyt
