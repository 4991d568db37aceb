#include "platform/linux/toml/FlatToml.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <utility>
#include <vector>

#include "platform/base/TextEscape.h"

namespace kyt {
namespace {

std::string realText(double real) {
  char buffer[40];
  const auto end = std::to_chars(buffer, buffer + sizeof buffer, real).ptr;
  std::string text(buffer, end);
  // A whole number would read back as an integer.
  if (text.find_first_of(".einf") == std::string::npos) text += ".0";
  return text;
}

std::optional<std::string> tomlText(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::boolean:
      return value.boolValue() ? "true" : "false";
    case Value::Kind::integer:
      return std::to_string(value.longLongValue());
    case Value::Kind::unsignedInteger:
      if (value.unsignedLongLongValue() > static_cast<uint64_t>(INT64_MAX)) return std::nullopt;
      return std::to_string(value.unsignedLongLongValue());
    case Value::Kind::real:
      return realText(value.doubleValue());
    case Value::Kind::string:
      if (!isValidUTF8(value.string()->view())) return std::nullopt;
      return tomlQuoted(value.string()->view());
    default:
      return std::nullopt;
  }
}

// The text with lines first … last (from 1; none when first is 0) replaced, or `line` added at the end.
std::string withLine(std::string_view text, uint32_t first, uint32_t last, std::string_view line) {
  std::string out;
  out.reserve(text.size() + line.size() + 2);
  uint32_t number = 1;
  while (!text.empty()) {
    const size_t end = text.find('\n');
    const std::string_view current = text.substr(0, end == std::string_view::npos ? text.size() : end + 1);
    if (first == 0 || number < first || number > last) {
      out += current;
    } else if (number == first) {
      out += line;
    }
    text.remove_prefix(current.size());
    ++number;
  }
  if (first == 0) {
    if (!out.empty() && out.back() != '\n') out += '\n';
    out += line;
  }
  return out;
}

}  // namespace

Value FlatToml::value(std::string_view key) const {
  const auto found = entries.find(key);
  return found == entries.end() ? Value() : found->second.value;
}

size_t FlatToml::countWithPrefix(std::string_view prefix) const {
  size_t count = 0;
  for (auto entry = entries.lower_bound(prefix); entry != entries.end() && entry->first.starts_with(prefix);
       ++entry) {
    ++count;
  }
  return count;
}

std::optional<std::string> FlatToml::textWith(std::string_view key, const Value& value) const {
  if (key.empty() || !isValidUTF8(key)) return std::nullopt;
  std::string line;
  if (!value.isNull()) {
    const auto written = tomlText(value);
    if (!written) return std::nullopt;
    line = tomlKey(key) + " = " + *written + "\n";
  }
  const auto found = entries.find(key);
  const FlatTomlEntry none;
  const FlatTomlEntry& place = found == entries.end() ? none : found->second;
  std::string result = withLine(text, place.line, place.lastLine, line);
  if (result.size() > kMaxTomlBytes) return std::nullopt;
  // What is written must read back, with everything else untouched.
  const auto again = parseFlatToml(result, "");
  const auto* flat = std::get_if<FlatToml>(&again);
  if (flat == nullptr) return std::nullopt;
  const size_t others = entries.size() - (found == entries.end() ? 0 : 1);
  if (flat->entries.size() != others + (value.isNull() ? 0 : 1)) return std::nullopt;
  return result;
}

std::string FlatToml::textWithoutPrefix(std::string_view prefix) const {
  std::vector<std::pair<uint32_t, uint32_t>> gone;  // from line to line
  for (auto entry = entries.lower_bound(prefix); entry != entries.end() && entry->first.starts_with(prefix);
       ++entry)
    gone.emplace_back(entry->second.line, std::max(entry->second.line, entry->second.lastLine));
  std::sort(gone.begin(), gone.end());
  std::string kept;
  uint32_t line = 1;
  auto next = gone.begin();
  for (size_t at = 0; at < text.size(); ++line) {
    const size_t end = std::min(text.find('\n', at), text.size() - 1) + 1;
    while (next != gone.end() && next->second < line) ++next;
    if (next == gone.end() || line < next->first) kept.append(text, at, end - at);
    at = end;
  }
  return kept;
}

std::variant<FlatToml, TomlError> parseFlatToml(std::string_view text, std::string_view name) {
  auto parsed = parseToml(text, name);
  if (auto* error = std::get_if<TomlError>(&parsed)) return std::move(*error);
  FlatToml flat;
  flat.text = text;
  for (const auto& [key, node] : std::get<TomlTable>(parsed)) {
    auto value = node.scalar();
    if (!value) return tomlError(name, node.line, "\"" + key + "\" must be text, a boolean or a number");
    flat.entries.emplace(key, FlatTomlEntry{std::move(*value), node.line, node.lastLine});
  }
  return flat;
}

void FlatTomlFile::couldNotRead(int error, const std::string& text, std::optional<TomlError>& problem) {
  certain_ = false;
  if (!isMomentary(error)) {
    content_ = {};
    identity_ = {};
  }
  const MonotonicTime now = clock_.monotonic();
  if (readError_ == error && now < toldReadError_ + kToldAgainAfter) return;
  readError_ = error;
  toldReadError_ = now;
  problem = tomlError(path_, 0,
                      text + (isMomentary(error) ? ". What was read before counts until it can be read"
                                                 : ". The file is ignored until it can be read"));
}

const FlatToml& FlatTomlFile::current(std::optional<TomlError>& problem) {
  struct stat status = {};
  if (::stat(path_.c_str(), &status) != 0) {
    const int error = errno;
    if (error != ENOENT && error != ENOTDIR) {
      couldNotRead(error, errorText(error), problem);
      return content_;
    }
    content_ = {};
    identity_ = {};
    certain_ = false;
    return content_;
  }
  if (certain_ && identityOf(status) == identity_) return content_;
  auto contents = readRegularFile(path_, kMaxTomlBytes);
  const auto* wrong = std::get_if<ReadProblem>(&contents);
  if (wrong != nullptr && wrong->error != 0) {
    couldNotRead(wrong->error, wrong->text, problem);
    return content_;
  }
  std::optional<TomlError> error;
  content_ = {};
  if (wrong != nullptr) {
    identity_ = identityOf(status);
    error = tomlError(path_, 0, wrong->text);
  } else {
    identity_ = std::get<FileContents>(contents).identity;
    auto parsed = parseFlatToml(std::get<FileContents>(contents).bytes, path_);
    if (auto* wrongText = std::get_if<TomlError>(&parsed)) {
      error = std::move(*wrongText);
    } else {
      content_ = std::move(std::get<FlatToml>(parsed));
    }
  }
  certain_ = !changedJustNow(identity_);
  if (error && reported_ != identity_) {
    problem = TomlError{error->text + ". The file is ignored"};
    reported_ = identity_;
  }
  return content_;
}

}  // namespace kyt
