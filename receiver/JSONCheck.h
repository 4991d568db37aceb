// Opens a post and looks whether it is what the daemon sends: JSON with a list of flat records (docs/WIRE-HTTPS.md). Reads it
// as it is inflated and keeps one string of it at a time (Limits::maxJSONStringBytes), so a bomb costs little memory, and not
// much time. Any thread, no state.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace kyt::receiver {

struct PostProblem {
  bool isGzip = false;  // it lies in the compression, not in the JSON
  std::string text;     // a sentence for people
};

[[nodiscard]] std::optional<PostProblem> problemOfPost(std::string_view body, bool isGzip);

struct PostLook {
  bool hasMore = false;  // than the bytes that were to be looked at: nothing is known of it
  std::optional<PostProblem> problem;
};
// The same, but of a post that has no more than so many bytes once it is opened.
[[nodiscard]] PostLook lookAtPost(std::string_view body, bool isGzip, uint64_t mostBytes);

// Bytes that a compressed body of so many may have.
[[nodiscard]] uint64_t mostInflatedBytes(size_t compressed);

}  // namespace kyt::receiver
