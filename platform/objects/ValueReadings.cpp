// How a Value reads as a number or a truth, and when two Values are equal.
#include <charconv>
#include <cmath>
#include <limits>

#include "platform/objects/Value.h"

namespace kyt {
namespace {

constexpr double kTwoTo63 = 9223372036854775808.0;
constexpr double kTwoTo64 = 18446744073709551616.0;

bool isBlank(char c) {
  return c == ' ' || (c >= '\t' && c <= '\r');
}
bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// What stands before the digits of a number is taken off the text; whether there was a minus sign.
bool takeBlanksAndSign(std::string_view& text) {
  while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
  if (text.empty() || (text.front() != '-' && text.front() != '+')) return false;
  const bool negative = text.front() == '-';
  text.remove_prefix(1);
  return negative;
}

uint64_t saturatingDigits(std::string_view text) {
  constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();
  uint64_t number = 0;
  for (const char c : text) {
    if (!isDigit(c)) break;
    const auto digit = static_cast<uint64_t>(c - '0');
    if (number > (kMax - digit) / 10) return kMax;
    number = number * 10 + digit;
  }
  return number;
}

int64_t integerOfText(std::string_view text) {
  const bool negative = takeBlanksAndSign(text);
  const uint64_t magnitude = saturatingDigits(text);
  constexpr auto kMax = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
  if (negative)
    return magnitude > kMax ? std::numeric_limits<int64_t>::min() : -static_cast<int64_t>(magnitude);
  return magnitude > kMax ? std::numeric_limits<int64_t>::max() : static_cast<int64_t>(magnitude);
}

uint64_t unsignedOfText(std::string_view text) {
  std::string_view digits = text;
  if (takeBlanksAndSign(digits)) return static_cast<uint64_t>(integerOfText(text));
  return saturatingDigits(digits);
}

double realOfText(std::string_view text) {
  const bool negative = takeBlanksAndSign(text);
  // "inf" and "nan" are no digits.
  if (text.empty() || !(isDigit(text.front()) || text.front() == '.')) return 0;
  double number = 0;
  const auto result = std::from_chars(text.data(), text.data() + text.size(), number);
  if (result.ec == std::errc::result_out_of_range)
    number = std::strtod(std::string(text.data(), result.ptr).c_str(), nullptr);  // huge, or next to nothing
  return negative ? -number : number;
}

int64_t integerOfReal(double number) {
  if (std::isnan(number)) return 0;
  if (number >= kTwoTo63) return std::numeric_limits<int64_t>::max();
  if (number < -kTwoTo63) return std::numeric_limits<int64_t>::min();
  return static_cast<int64_t>(number);
}

uint64_t unsignedOfReal(double number) {
  if (!(number > 0)) return 0;
  if (number >= kTwoTo64) return std::numeric_limits<uint64_t>::max();
  return static_cast<uint64_t>(number);
}

// A number that is not a double: its sign apart, so that both 64-bit kinds compare.
struct Whole {
  bool negative;
  uint64_t bits;
  friend bool operator==(const Whole&, const Whole&) = default;
};

std::optional<Whole> whole(const Value& value) {
  if (const auto number = value.real()) {
    if (!(*number >= -kTwoTo63 && *number < kTwoTo64) || std::trunc(*number) != *number) return std::nullopt;
    if (*number < 0) return Whole{true, static_cast<uint64_t>(static_cast<int64_t>(*number))};
    return Whole{false, static_cast<uint64_t>(*number)};
  }
  const int64_t number = value.longLongValue();
  return Whole{!value.unsignedInteger() && number < 0, static_cast<uint64_t>(number)};
}

bool equalNumbers(const Value& a, const Value& b) {
  if (a.real() && b.real()) return *a.real() == *b.real();
  const auto left = whole(a);
  return left && left == whole(b);
}

}  // namespace

int64_t Value::longLongValue() const noexcept {
  switch (kind()) {
    case Kind::boolean:
    case Kind::integer:
    case Kind::unsignedInteger:
      return static_cast<int64_t>(cell_.word);
    case Kind::real:
      return integerOfReal(*real());
    case Kind::string:
      return integerOfText(detail::textOf(cell_));
    default:
      return 0;
  }
}

uint64_t Value::unsignedLongLongValue() const noexcept {
  switch (kind()) {
    case Kind::boolean:
    case Kind::integer:
    case Kind::unsignedInteger:
      return cell_.word;
    case Kind::real:
      return unsignedOfReal(*real());
    case Kind::string:
      return unsignedOfText(detail::textOf(cell_));
    default:
      return 0;
  }
}

double Value::doubleValue() const noexcept {
  switch (kind()) {
    case Kind::boolean:
    case Kind::integer:
      return static_cast<double>(static_cast<int64_t>(cell_.word));
    case Kind::unsignedInteger:
      return static_cast<double>(cell_.word);
    case Kind::real:
      return *real();
    case Kind::string:
      return realOfText(detail::textOf(cell_));
    default:
      return 0;
  }
}

bool Value::boolValue() const noexcept {
  if (kind() == Kind::real) return *real() != 0;
  if (isNumber()) return cell_.word != 0;
  if (!isString()) return false;
  std::string_view text = detail::textOf(cell_);
  takeBlanksAndSign(text);
  while (!text.empty() && text.front() == '0') text.remove_prefix(1);
  if (text.empty()) return false;
  const char c = text.front();
  return (c >= '1' && c <= '9') || c == 'T' || c == 't' || c == 'Y' || c == 'y';
}

bool operator==(const Value& a, const Value& b) noexcept {
  if (a.isNumber() && b.isNumber()) return equalNumbers(a, b);
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case Value::Kind::null:
      return true;
    case Value::Kind::date:
      return a.date() == b.date();
    case Value::Kind::string:
      return *a.string() == *b.string();
    case Value::Kind::data:
      return *a.data() == *b.data();
    case Value::Kind::array:
      return *a.array() == *b.array();
    case Value::Kind::dictionary:
      return *a.dictionary() == *b.dictionary();
    default:
      return false;
  }
}

}  // namespace kyt
