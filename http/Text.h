// Small helpers for text that crosses a server's borders. Any thread, no state.
#pragma once

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>

namespace kyt::http {

// The same text in valid UTF-8: every byte that is part of no well-formed character becomes \xNN.
[[nodiscard]] std::string validText(std::string_view bytes);

// The text with control characters as \xNN, for terminals.
[[nodiscard]] std::string printable(std::string_view bytes);

[[nodiscard]] bool equalIgnoringCase(std::string_view a, std::string_view b);
[[nodiscard]] std::optional<int64_t> parseInteger(std::string_view text);  // the whole text, decimal
[[nodiscard]] std::optional<double> parseNumber(std::string_view text);    // the whole text, finite
[[nodiscard]] std::optional<std::string> bytesFromHex(std::string_view text);
[[nodiscard]] std::string base64(std::string_view bytes);

// "Sat, 31 Jan 2026 12:00:00 GMT"
[[nodiscard]] std::string httpDate(std::time_t time);

// Seconds since 1970.
[[nodiscard]] double timeNow();

}  // namespace kyt::http
