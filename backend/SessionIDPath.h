// Session identifiers joined by ".", root first. In a hierarchy of thousands of levels the joined texts of all its
// sessions are millions of bytes, and each session that comes changes those of all beneath it. So the sessions of a
// hierarchy share one text of their ancestors, and a session's own is joined only when somebody reads it.
#pragma once

#include <concepts>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/objects/Value.h"

namespace kyt {

// What stands above a session: the first `length` bytes of a text that others share. Constant.
struct AncestorIdentifiers {
  std::shared_ptr<const std::string> text;
  size_t length = 0;
  [[nodiscard]] std::string_view view() const { return std::string_view(*text).substr(0, length); }
};

// A session's combined identifier. A value; copies share the joined text. Any thread.
class SessionIDPath {
 public:
  // Of a session without ancestors, or a text that is joined already.
  template <typename Text>  // NOLINTNEXTLINE(bugprone-forwarding-reference-overload): a path is no such text
  requires std::constructible_from<String, Text> SessionIDPath(
      Text&& identifier)  // NOLINT(google-explicit-constructor): a text is a path
      : identifier_(std::forward<Text>(identifier)) {}
  // "ancestors.identifier"
  SessionIDPath(AncestorIdentifiers ancestors, String identifier);

  [[nodiscard]] String text() const;
  // Whether text() costs nothing.
  [[nodiscard]] bool isJoined() const;

 private:
  struct Joined;
  String identifier_;
  std::shared_ptr<Joined> joined_;  // null: there are no ancestors
};

}  // namespace kyt
