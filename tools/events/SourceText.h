// Texts of an events.toml within source code and pages: nothing that they hold ends a comment, a literal or a table's cell.
// Precondition everywhere: valid UTF-8 without control characters but line breaks and tabs. Pure; any thread.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace kyt::tools {

// Its words in lines of at most so many bytes, where no word is longer; its line breaks stay.
[[nodiscard]] std::vector<std::string> wrapped(std::string_view text, size_t width);

// "/* … */" and "// …", with the indent in front of each line and a line break at the end.
[[nodiscard]] std::string blockComment(std::string_view text, const std::string& indent);
[[nodiscard]] std::string lineComment(std::string_view text, const std::string& indent);
// Python's: the text between its three quotes, whose lines all have the indent.
[[nodiscard]] std::string docString(std::string_view text, const std::string& indent);

// A literal of C and C++, and one of Python, with their quotes.
[[nodiscard]] std::string literal(std::string_view text);
[[nodiscard]] std::string pythonLiteral(std::string_view text);

}  // namespace kyt::tools
