// How objects are written as an XML property list.
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>

#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/objects/Base64.h"

namespace kyt {
namespace {

constexpr double kFirstYear = -62167219200;     // 0000-01-01
constexpr double kPastLastYear = 253402300800;  // 10000-01-01

bool canBeCarried(const Value& value) {
  if (const auto date = value.date())
    return date->secondsSince1970 >= kFirstYear && date->secondsSince1970 < kPastLastYear;
  return !value.isNull();
}

void appendEscaped(std::string& out, std::string_view text) {
  for (const char c : text) {
    switch (c) {
      case '&':
        out += "&amp;";
        break;
      case '<':
        out += "&lt;";
        break;
      case '>':
        out += "&gt;";
        break;
      case '\r':
        out += "&#13;";
        break;  // a plain one would be read back as a line feed
      case '\t':
      case '\n':
        out += c;
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          out += "\xEF\xBF\xBD";
        } else {
          out += c;
        }
    }
  }
}

std::string dateText(Date date) {
  using namespace std::chrono;
  const auto time = sys_seconds(seconds(static_cast<int64_t>(std::floor(date.secondsSince1970))));
  const auto day = floor<days>(time);
  const year_month_day civil(day);
  const hh_mm_ss clock(time - day);
  char text[64];
  std::snprintf(text, sizeof text, "%04d-%02u-%02uT%02d:%02d:%02dZ", static_cast<int>(civil.year()),
                static_cast<unsigned>(civil.month()), static_cast<unsigned>(civil.day()),
                static_cast<int>(clock.hours().count()), static_cast<int>(clock.minutes().count()),
                static_cast<int>(clock.seconds().count()));
  return text;
}

std::string realText(double number) {
  if (std::isinf(number)) return number > 0 ? "+infinity" : "-infinity";
  return decimalText(number);
}

void appendElement(std::string& out, const char* name, std::string_view text) {
  out.append("<").append(name).append(">");
  appendEscaped(out, text);
  out.append("</").append(name).append(">\n");
}

void appendObject(std::string& out, const Value& value, size_t depth) {
  if (!canBeCarried(value)) return;
  out.append(depth, '\t');
  if (const Dictionary* dictionary = value.dictionary()) {
    out += "<dict>\n";
    for (const DictionaryEntry& entry : *dictionary) {
      if (!canBeCarried(entry.value)) continue;
      out.append(depth + 1, '\t');
      appendElement(out, "key", entry.key);
      appendObject(out, entry.value, depth + 1);
    }
    out.append(depth, '\t').append("</dict>\n");
  } else if (const Array* array = value.array()) {
    out += "<array>\n";
    for (const Value& element : *array) appendObject(out, element, depth + 1);
    out.append(depth, '\t').append("</array>\n");
  } else if (const auto truth = value.boolean()) {
    out += *truth ? "<true/>\n" : "<false/>\n";
  } else if (value.string() != nullptr) {
    appendElement(out, "string", *value.string());
  } else if (value.data() != nullptr) {
    appendElement(out, "data", base64(value.data()->bytes()));
  } else if (const auto date = value.date()) {
    appendElement(out, "date", dateText(*date));
  } else if (const auto real = value.real()) {
    appendElement(out, "real", realText(*real));
  } else {
    appendElement(out, "integer", description(value));
  }
}

}  // namespace

std::string PugixmlPropertyLists::serialize(const Value& value) {
  std::string out = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n";
  appendObject(out, value, 0);
  out += "</plist>\n";
  return out;
}

}  // namespace kyt
