// Objects as text for people: log lines, messages, the local message log. Also "%@" templates.
//
// Containers are written as compact JSON by a writer of this folder's own, so that describing an object needs
// no port; it is not on the road of an event.
#include <charconv>
#include <cmath>
#include <cstdio>

#include "platform/base/Hex.h"
#include "platform/objects/Description.h"
#include "platform/objects/Value.h"

namespace kyt {
namespace {

void appendNumber(std::string& out, auto number) {
  char digits[24];
  const auto result = std::to_chars(digits, digits + sizeof digits, number);
  out.append(digits, result.ptr);
}

// The civil date of a count of days since 1970-01-01, in the Gregorian calendar carried on in both
// directions.
struct CivilDate {
  int64_t year;
  int month;
  int day;
};

CivilDate civilDate(int64_t days) {
  days += 719468;  // from 0000-03-01, so that the leap day ends a year
  const int64_t era = (days >= 0 ? days : days - 146096) / 146097;
  const int64_t dayOfEra = days - era * 146097;
  const int64_t yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
  const int64_t dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
  const int64_t shifted = (5 * dayOfYear + 2) / 153;
  const int month = static_cast<int>(shifted < 10 ? shifted + 3 : shifted - 9);
  return {yearOfEra + era * 400 + (month <= 2 ? 1 : 0), month,
          static_cast<int>(dayOfYear - (153 * shifted + 2) / 5 + 1)};
}

void appendDate(std::string& out, Date date) {
  constexpr double kMostSeconds = 1e15;  // some 30 million years: past it only the number makes sense
  if (!(std::fabs(date.secondsSince1970) < kMostSeconds)) {
    out += decimalText(date.secondsSince1970);
    return;
  }
  const auto seconds = static_cast<int64_t>(std::floor(date.secondsSince1970));
  const int64_t days = (seconds >= 0 ? seconds : seconds - 86399) / 86400;
  const auto ofDay = static_cast<int>(seconds - days * 86400);
  const CivilDate civil = civilDate(days);
  char text[64];
  const int length = std::snprintf(text, sizeof text, "%04lld-%02d-%02d %02d:%02d:%02d +0000",
                                   static_cast<long long>(civil.year), civil.month, civil.day, ofDay / 3600,
                                   ofDay / 60 % 60, ofDay % 60);
  out.append(text, static_cast<size_t>(length));
}

void appendQuoted(std::string& out, std::string_view text) {
  out += '"';
  for (const char c : text) {
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          char escape[8];
          std::snprintf(escape, sizeof escape, "\\u%04x", static_cast<unsigned>(c));
          out += escape;
        } else {
          out += c;
        }
    }
  }
  out += '"';
}

void appendJSON(std::string& out, const Value& value);

void appendContainer(std::string& out, const Array& array) {
  out += '[';
  for (const Value& value : array) {
    if (&value != array.begin()) out += ',';
    appendJSON(out, value);
  }
  out += ']';
}

void appendContainer(std::string& out, const Dictionary& dictionary) {
  out += '{';
  for (const DictionaryEntry& entry : dictionary) {
    if (&entry != dictionary.begin()) out += ',';
    appendQuoted(out, entry.key);
    out += ':';
    appendJSON(out, entry.value);
  }
  out += '}';
}

void appendScalar(std::string& out, const Value& value) {
  switch (value.kind()) {
    case Value::Kind::boolean:
      out += *value.boolean() ? "1" : "0";
      break;
    case Value::Kind::integer:
      appendNumber(out, *value.integer());
      break;
    case Value::Kind::unsignedInteger:
      appendNumber(out, *value.unsignedInteger());
      break;
    case Value::Kind::real:
      out += decimalText(*value.real());
      break;
    case Value::Kind::date:
      appendDate(out, *value.date());
      break;
    case Value::Kind::data:
      out += '<';
      appendHex(value.data()->bytes(), out);
      out += '>';
      break;
    case Value::Kind::string:
      out += value.string()->view();
      break;
    default:
      out += "(null)";
      break;
  }
}

void appendJSON(std::string& out, const Value& value) {
  if (const Array* array = value.array()) return appendContainer(out, *array);
  if (const Dictionary* dictionary = value.dictionary()) return appendContainer(out, *dictionary);
  if (value.isNull()) {
    out += "null";
  } else if (const auto truth = value.boolean()) {
    out += *truth ? "true" : "false";
  } else if (value.isNumber() && std::isfinite(value.doubleValue())) {
    appendScalar(out, value);
  } else {
    std::string text;
    appendScalar(text, value);
    appendQuoted(out, text);
  }
}

void appendDescription(std::string& out, const Value& value) {
  if (value.isArray() || value.isDictionary()) {
    appendJSON(out, value);
  } else {
    appendScalar(out, value);
  }
}

}  // namespace

std::string decimalText(double number) {
  const double magnitude = std::fabs(number);
  const bool plain = magnitude == 0 || (magnitude >= 1e-6 && magnitude < 1e17);
  char digits[64];
  const auto result = plain ? std::to_chars(digits, digits + sizeof digits, number, std::chars_format::fixed)
                            : std::to_chars(digits, digits + sizeof digits, number);
  return std::string(digits, result.ptr);
}

std::string description(const Value& value) {
  std::string out;
  appendDescription(out, value);
  return out;
}

std::string formatObjects(const char* format, std::initializer_list<Value> objects) {
  std::string out;
  appendObjects(out, format, objects);
  return out;
}

void appendObjects(std::string& out, const char* format, std::initializer_list<Value> objects) {
  const std::string_view text(format);
  const Value* next = objects.begin();
  for (size_t i = 0; i < text.size(); ++i) {
    const size_t conversion =
        text[i] == '%' ? text.find_first_not_of("-+ #0123456789.hlLqjzt", i + 1) : text.npos;
    if (conversion == text.npos) {
      out += text[i];
      continue;
    }
    if (text[conversion] == '%') {
      out += '%';
    } else {
      appendDescription(out, next == objects.end() ? Value() : *next++);
    }
    i = conversion;
  }
}

}  // namespace kyt
