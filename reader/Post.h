// A post as the receiver put it into the log: the body as the device sent it, its facts as headers. Pure; any thread.
#pragma once

#include <cstdint>
#include <string>
#include <variant>

namespace kyt::reader {

struct Post {
  std::string id;        // SHA-256 of the body, hexadecimal: what repeats are known by
  std::string received;  // milliseconds since 1970, decimal
  std::string path, sender, client, service, clientVersion, digest;
  std::string encoding;  // "gzip", or "identity"
  std::string problem;   // why its facts cannot be told; empty: they can
  std::string body;
};

// Why a post has no text.
struct Unreadable {
  std::string reason;
};

// A post may inflate to so many bytes; the daemon's batches are a quarter of that at most.
inline constexpr uint64_t kMostText = uint64_t{64} << 20;

// The JSON that the device wrote. Whether it is JSON the database tells.
[[nodiscard]] std::variant<std::string, Unreadable> textOf(const Post& post);

}  // namespace kyt::reader
