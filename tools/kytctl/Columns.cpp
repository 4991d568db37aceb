#include "tools/kytctl/Columns.h"

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <iterator>
#include <utility>

#include "platform/base/TextEscape.h"

namespace kyt::tools {

namespace {

// Of lines that go on, or belong to the one above.
constexpr std::string_view kIndent = "      ";

// How many bytes of a text of UTF-8 so many characters take, at most all.
size_t bytesOf(std::string_view text, size_t characters) {
  size_t end = 0;
  for (; end < text.size() && characters > 0; --characters)
    end += std::max<size_t>(utf8SequenceLength(text.substr(end)), 1);
  return end;
}

std::tm localTime(int64_t seconds) {
  const std::time_t time = seconds;
  std::tm local{};
  static_cast<void>(::localtime_r(&time, &local));
  return local;
}

}  // namespace

size_t charactersIn(std::string_view text) {
  return static_cast<size_t>(std::count_if(
      text.begin(), text.end(), [](char c) { return (static_cast<unsigned char>(c) & 0xC0) != 0x80; }));
}

std::string cutText(std::string_view text, size_t most) {
  std::string shown = escapedText(text);
  if (charactersIn(shown) <= most) return shown;
  return shown.substr(0, bytesOf(shown, std::max<size_t>(most, 1) - 1)) + "…";
}

std::string foldedText(std::string_view text) {
  const std::string shown = escapedText(text);
  std::string lines;
  std::string_view rest = shown, indent;
  do {
    const size_t most = bytesOf(rest, kMostCharacters - indent.size());
    const size_t blank = most < rest.size() ? rest.rfind(' ', most - 1) : std::string_view::npos;
    const size_t end = blank != std::string_view::npos && blank >= most / 2 ? blank + 1 : most;
    std::string_view line = rest.substr(0, end);
    rest.remove_prefix(end);
    if (!rest.empty() && line.ends_with(' ')) line.remove_suffix(1);
    lines.append(indent).append(line).append("\n");
    indent = kIndent;
  } while (!rest.empty());
  return lines;
}

void Columns::add(std::vector<std::string> row) {
  row.resize(columns_.size());
  for (size_t i = 0; i < row.size(); ++i) row[i] = cutText(row[i].empty() ? "-" : row[i], columns_[i].most);
  rows_.push_back(std::move(row));
  notes_.emplace_back();
}

void Columns::addNote(std::string_view text) {
  notes_.back().append(kIndent).append(cutText(text, kMostCharacters - kIndent.size())).append("\n");
}

std::string Columns::text() const {
  std::vector<size_t> widths;
  for (size_t i = 0; i < columns_.size(); ++i) {
    size_t width = charactersIn(columns_[i].title);
    for (const auto& row : rows_) width = std::max(width, charactersIn(row[i]));
    widths.push_back(width);
  }
  std::string text;
  const auto line = [&](const auto& textOf) {
    std::string out;
    for (size_t i = 0; i < columns_.size(); ++i) {
      const std::string cell = textOf(i);
      const std::string padding(widths[i] - charactersIn(cell), ' ');
      out += (i == 0 ? "" : "  ") + (columns_[i].right ? padding + cell : cell + padding);
    }
    while (!out.empty() && out.back() == ' ') out.pop_back();
    text += out + "\n";
  };
  line([&](size_t i) { return columns_[i].title; });
  for (size_t row = 0; row < rows_.size(); ++row) {
    line([&](size_t i) { return rows_[row][i]; });
    text += notes_[row];
  }
  return text;
}

std::string clockText(int64_t seconds, int64_t now) {
  if (seconds == 0) return "never";
  const std::tm then = localTime(seconds), today = localTime(now);
  const bool isToday = then.tm_year == today.tm_year && then.tm_yday == today.tm_yday;
  char text[32] = "";
  static_cast<void>(isToday ? std::strftime(text, sizeof text, "%H:%M:%S", &then)
                            : std::strftime(text, sizeof text, "%Y-%m-%d %H:%M", &then));
  return text;
}

std::string spanText(int64_t seconds) {
  constexpr int64_t kMinute = 60, kHour = 60 * kMinute, kDay = 24 * kHour;
  if (seconds < 2 * kMinute) return std::to_string(seconds) + " s";
  if (seconds < 2 * kHour) return std::to_string(seconds / kMinute) + " min";
  if (seconds < 2 * kDay) return std::to_string(seconds / kHour) + " h";
  return std::to_string(seconds / kDay) + " d";
}

std::string bytesText(uint64_t bytes) {
  constexpr const char* kUnits[] = {"B", "KiB", "MiB", "GiB", "TiB"};
  auto number = static_cast<double>(bytes);
  size_t unit = 0;
  while (number >= 1024 && unit + 1 < std::size(kUnits)) {
    number /= 1024;
    ++unit;
  }
  char text[32];
  std::snprintf(text, sizeof text, unit != 0 && number < 10 ? "%.1f %s" : "%.0f %s", number, kUnits[unit]);
  return text;
}

}  // namespace kyt::tools
