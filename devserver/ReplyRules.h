// Replies that a test tells the server to give: the next posts to a path answer 503, come late, or never
// come. Any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "devserver/Post.h"
#include "platform/base/Mutex.h"

namespace kyt::devserver {

struct ReplyRule {
  std::string path;                // this path and everything below it
  std::optional<unsigned> status;  // absent: the answer is what it would be
  std::optional<std::string> body;
  std::vector<Header> headers;
  std::chrono::milliseconds delay{0};
  uint64_t times = 1;  // how often; 0: until it is taken back
  bool hang = false;   // no answer until the rules change, ten minutes at most
  bool close = false;  // the connection ends without an answer
};

class ReplyRules {
 public:
  // A rule from the JSON text that a test puts, or what is wrong with it.
  [[nodiscard]] static std::variant<ReplyRule, std::string> parse(const std::string& json);

  void add(ReplyRule rule) EXCLUDES(mutex_);
  void clear() EXCLUDES(mutex_);
  // The first rule for the path, used up by one.
  [[nodiscard]] std::optional<ReplyRule> take(std::string_view path) EXCLUDES(mutex_);
  [[nodiscard]] std::string asJson() EXCLUDES(mutex_);
  // Grows whenever the rules are cleared; requests that hang watch it.
  [[nodiscard]] uint64_t generation() EXCLUDES(mutex_);

 private:
  Mutex mutex_;
  std::vector<ReplyRule> rules_ GUARDED_BY(mutex_);
  uint64_t generation_ GUARDED_BY(mutex_) = 0;
};

}  // namespace kyt::devserver
