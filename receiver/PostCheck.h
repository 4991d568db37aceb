// Judges a post by what can be seen without opening it: path, length, encoding, digest; and names its facts. Constant
// after construction, any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "http/Http.h"
#include "receiver/EventLog.h"
#include "receiver/Figures.h"
#include "receiver/Settings.h"

namespace kyt::receiver {

struct Rejection {
  Refusal refusal;
  unsigned status;
  std::string text;  // a sentence for people
};

class PostCheck {
 public:
  explicit PostCheck(const Settings& settings) : settings_(settings) {}  // which outlives this

  [[nodiscard]] const PathSettings* pathOf(std::string_view urlPath) const;  // null: there is none
  // What the headers alone say.
  [[nodiscard]] std::optional<Rejection> rejectionByHeaders(const http::Request& request) const;
  // The body is whole. `hasDigest`: whether it carries one that was found right.
  [[nodiscard]] std::optional<Rejection> rejection(const http::Request& request, bool& hasDigest) const;

 private:
  [[nodiscard]] std::optional<Rejection> rejectionOfDigest(const PathSettings& path,
                                                           const http::Request& request,
                                                           bool& hasDigest) const;
  const Settings& settings_;
};

// The headers of its message in the log: "Kyt-Id", "Kyt-Received" and so on. Nothing of them says where it came from.
[[nodiscard]] std::vector<std::pair<std::string, std::string>> factsOf(const http::Request& request,
                                                                       const std::string& id,
                                                                       int64_t receivedMilliseconds,
                                                                       bool hasDigest);
// What its header says of its body's encoding.
[[nodiscard]] bool isGzip(const http::Request& request);
// SHA-256 in hexadecimal digits.
[[nodiscard]] std::string messageID(std::string_view body);

}  // namespace kyt::receiver
