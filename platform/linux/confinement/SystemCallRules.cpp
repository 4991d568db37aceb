#include "platform/linux/confinement/SystemCallRules.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <optional>

#include "platform/linux/confinement/SystemCallConstants.h"
#include "platform/linux/confinement/SystemCallFilter.h"

namespace kyt {
namespace {

constexpr uint64_t kWord = 0xFFFFFFFF;  // integers have 32 bits; what stands above them the kernel ignores
constexpr unsigned kMaxArguments = 6;
constexpr int kMaxNumber = 4095;

std::string_view trimmed(std::string_view text) {
  while (text.starts_with(' ')) text.remove_prefix(1);
  while (text.ends_with(' ')) text.remove_suffix(1);
  return text;
}

std::optional<uint64_t> number(std::string_view text) {
  const int base = text.starts_with("0x") ? 16 : 10;
  if (base == 16) text.remove_prefix(2);
  uint32_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value, base);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

std::optional<uint64_t> valueOf(std::string_view text) {
  if (const auto value = number(text)) return value;
  for (const SystemCallConstant& constant : kSystemCallConstants) {
    if (constant.name == text) return constant.value;
  }
  return std::nullopt;
}

// "A|B", blanks around the names allowed.
std::optional<uint64_t> bitsOf(std::string_view text) {
  uint64_t bits = 0;
  while (true) {
    const size_t bar = text.find('|');
    const auto value = valueOf(trimmed(text.substr(0, bar)));
    if (!value) return std::nullopt;
    bits |= *value;
    if (bar == std::string_view::npos) return bits;
    text.remove_prefix(bar + 1);
  }
}

// No value: wrong.
std::optional<ArgumentCondition> condition(unsigned argument, std::string_view text) {
  if (text == "NULL") return ArgumentCondition{argument, ~0ULL, 0};
  if (text == "SELF") return ArgumentCondition{argument, kWord, static_cast<uint64_t>(::getpid())};
  if (text.starts_with("only ")) {
    const auto bits = bitsOf(text.substr(5));
    if (!bits) return std::nullopt;
    return ArgumentCondition{argument, ~*bits & kWord, 0};
  }
  if (text.starts_with("has ")) {
    const size_t without = text.find(" no ");
    const auto bits = bitsOf(text.substr(4, without == std::string_view::npos ? without : without - 4));
    const auto none = without == std::string_view::npos ? 0 : bitsOf(text.substr(without + 4));
    if (!bits || !none || (*bits & *none) != 0) return std::nullopt;
    return ArgumentCondition{argument, *bits | *none, *bits};
  }
  if (text.starts_with("no ")) {
    const auto bits = bitsOf(text.substr(3));
    if (!bits) return std::nullopt;
    return ArgumentCondition{argument, *bits, 0};
  }
  const auto value = valueOf(text);
  if (!value) return std::nullopt;
  return ArgumentCondition{argument, kWord, *value};
}

std::variant<SystemCallRule, std::string> ruleOfNumbers(std::string_view entry, size_t dots) {
  const auto first = number(entry.substr(0, dots)), last = number(entry.substr(dots + 2));
  if (!first || !last || *first > *last || *last > kMaxNumber) return "is no range of numbers";
  SystemCallRule rule{std::string(entry), {}};
  for (uint64_t each = *first; each <= *last; ++each) rule.numbers.push_back(static_cast<int>(each));
  return rule;
}

// Whether that call's arguments lie in memory, where no filter can look at them. On i386 the number of "mmap" is that of an
// old form with a pointer to all six.
bool hidesItsArguments([[maybe_unused]] std::string_view call) {
#ifdef __i386__
  return call == "mmap";
#else
  return false;
#endif
}

}  // namespace

std::variant<SystemCallRule, std::string> parseSystemCallRule(std::string_view entry) {
  if (const size_t dots = entry.find(".."); dots != std::string_view::npos) return ruleOfNumbers(entry, dots);
  const size_t open = entry.find('(');
  SystemCallRule rule{std::string(entry.substr(0, open)), {}};
  const std::optional<int> call = systemCallNumber(rule.call);
  if (!call) return "is no system call";
  if (*call >= 0 && !(open != std::string_view::npos && hidesItsArguments(rule.call)))
    rule.numbers.push_back(*call);
  if (open == std::string_view::npos) return rule;
  if (!entry.ends_with(')')) return "has no closing parenthesis";
  std::string_view rest = entry.substr(open + 1, entry.size() - open - 2);
  for (unsigned argument = 0;; ++argument) {
    if (argument == kMaxArguments) return "has more than six arguments";
    const size_t comma = rest.find(',');
    const std::string_view text = trimmed(rest.substr(0, comma));
    if (text != "*") {
      const auto made = condition(argument, text);
      if (!made) return "has a wrong argument \"" + std::string(text) + "\"";
      rule.conditions.push_back(*made);
    }
    if (comma == std::string_view::npos) break;
    rest.remove_prefix(comma + 1);
  }
  return rule;
}

int errorNumber(std::string_view name) {
  constexpr struct {
    std::string_view name;
    int number;
  } kErrors[] = {{"EPERM", EPERM},   {"EACCES", EACCES},
                 {"ENOSYS", ENOSYS}, {"EAFNOSUPPORT", EAFNOSUPPORT},
                 {"EINVAL", EINVAL}, {"EOPNOTSUPP", EOPNOTSUPP}};
  const auto* found = std::find_if(std::begin(kErrors), std::end(kErrors),
                                   [name](const auto& error) { return error.name == name; });
  return found == std::end(kErrors) ? 0 : found->number;
}

}  // namespace kyt
