// Rows of texts in columns for people, in at most 100 characters a line. Texts come from clients and servers and may hold
// anything: they are escaped, and cut with "…" where they are longer than their column may be.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace kyt::tools {

inline constexpr size_t kMostCharacters = 100;

class Columns {
 public:
  struct Column {
    std::string title;
    size_t most;  // characters
    bool right = false;
  };
  // The widths and the two blanks between columns add up to kMostCharacters at most.
  explicit Columns(std::vector<Column> columns) : columns_(std::move(columns)) {}
  void add(std::vector<std::string> row);  // a text for each column
  // A line beneath the row that was added last, further to the right.
  void addNote(std::string_view text);
  // Title line and rows. Columns are as wide as what is in them.
  [[nodiscard]] std::string text() const;

 private:
  const std::vector<Column> columns_;
  std::vector<std::vector<std::string>> rows_;
  std::vector<std::string> notes_;  // beneath each row: whole lines
};

[[nodiscard]] size_t charactersIn(std::string_view text);
// Escaped, and cut to so many characters.
[[nodiscard]] std::string cutText(std::string_view text, size_t most);
// Escaped, in lines of at most kMostCharacters, each with its line feed: the second and further ones stand further to the
// right. They end behind a blank where one is in their second half.
[[nodiscard]] std::string foldedText(std::string_view text);
// "12:03:59" today, otherwise "2026-11-22 12:03", by the local clock; "never" for 0.
[[nodiscard]] std::string clockText(int64_t seconds, int64_t now);
// "17 s", "5 min", "3 h", "2 d".
[[nodiscard]] std::string spanText(int64_t seconds);
// "512 B", "3.4 KiB", "12 MiB".
[[nodiscard]] std::string bytesText(uint64_t bytes);

}  // namespace kyt::tools
