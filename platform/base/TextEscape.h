// Makes text from outside safe to show: every log sink, the tools and the development server's page pass what
// they write through this, so that nobody can forge a line or steer a terminal.
//
// Tab, line feed and carriage return become \t, \n and \r; other control characters (U+0000 to U+001F, U+007F
// to U+009F), the line and paragraph separators, the marks that reorder text (U+202A to U+202E, U+2066 to
// U+2069) and every byte that is no valid UTF-8 become \xHH, two lower-case digits a byte. A backslash stays
// as it is: ordinary text is never changed. Any thread, no state.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace kyt {

void appendEscaped(std::string& out, std::string_view text);
[[nodiscard]] std::string escapedText(std::string_view text);
// The same for names that are told from each other: a backslash of their own becomes \x5c, so that no two are written alike.
[[nodiscard]] std::string escapedName(std::string_view name);
// The same for a text that is JSON, and stays it: such characters become \uHHHH, what is no valid UTF-8 \ufffd.
[[nodiscard]] std::string escapedJSON(std::string_view json);
// The same with the line breaks of the text left as they are.
void appendEscapedLines(std::string& out, std::string_view text);
// How much of the text, whole characters, becomes at most so many bytes when it is escaped.
[[nodiscard]] size_t lengthThatFits(std::string_view text, size_t escapedBytes);
// Whether escapedText() would change nothing.
[[nodiscard]] bool isPlainText(std::string_view text);
// Whether the text is of ASCII that is shown as it is, and line breaks: then appendEscapedLines() changes nothing. Quick.
[[nodiscard]] bool isPlainLines(std::string_view text);
// The length of the valid UTF-8 sequence that `text` begins with, 0 when there is none.
[[nodiscard]] size_t utf8SequenceLength(std::string_view text);
[[nodiscard]] bool isValidUTF8(std::string_view text);

// The beginning of a text that gives its reader a right or follows a person, enough to tell such texts apart in a log:
// eight bytes and "..."; a text of twelve bytes or less is too short for that, and stays.
[[nodiscard]] std::string beginningOf(std::string_view text);

}  // namespace kyt
