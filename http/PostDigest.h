// The digest of a post of events: HMAC-SHA1 over the body as it was sent, as text in the header X-KYT-DIGEST. Any thread,
// no state.
#pragma once

#include <string>
#include <string_view>

namespace kyt::http {

// "<0a1b2c3d 4e5f6071 8293a4b5 c6d7e8f9 0a1b2c3d>"
[[nodiscard]] std::string digestText(std::string_view key, std::string_view body);

// Whether a post carries the digest of its body under that key. How long the comparison takes does not tell how much of
// the text was right, so nobody can find a digest by trying.
[[nodiscard]] bool digestFits(std::string_view key, std::string_view body, std::string_view text);

}  // namespace kyt::http
