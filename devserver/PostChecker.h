// Judges one event post: length, gzip, JSON shape, digest. Fills the verdict and the events in; what is wrong
// is said in one sentence that names the place. Constant after construction, any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "devserver/Options.h"
#include "devserver/Post.h"

namespace kyt::devserver {

class PostChecker {
 public:
  PostChecker(std::vector<DigestKey> keys, uint64_t maxInflatedBytes)
      : keys_(std::move(keys)), maxInflatedBytes_(maxInflatedBytes) {}

  // Precondition: headers, body, method and path are set and the body is whole.
  void check(Post& post) const;

  // Fills client, service and sender in from the headers.
  static void readNames(Post& post);

  // The JSON text of a body as sent, or why there is none.
  [[nodiscard]] std::optional<std::string> textOf(const std::vector<Header>& headers, std::string_view body,
                                                  std::string& reason) const;

 private:
  [[nodiscard]] bool checkDigest(Post& post) const;

  const std::vector<DigestKey> keys_;
  const uint64_t maxInflatedBytes_;
};

// The same JSON, compact or indented, or nothing when it is malformed or nested too deeply.
[[nodiscard]] std::optional<std::string> rewriteJson(std::string_view text, bool pretty);

}  // namespace kyt::devserver
