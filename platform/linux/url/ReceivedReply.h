// What has arrived of one request's reply, within its limits, and what that counts in its user's account. One thread at a
// time.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/URLSession.h"
#include "platform/base/OutstandingBytes.h"

namespace kyt {

class ReceivedReply {
 public:
  // `user`: the one it counts for; outlives this.
  explicit ReceivedReply(OutstandingBytes::User& user) : user_(user) {}
  ~ReceivedReply() { giveBack(); }
  ReceivedReply(const ReceivedReply&) = delete;
  ReceivedReply& operator=(const ReceivedReply&) = delete;

  enum class Taken : uint8_t { yes, tooLong, noRoom };
  // One line, its end included; a status line begins anew.
  [[nodiscard]] Taken takeHeader(std::string_view line);
  [[nodiscard]] Taken takeBody(std::string_view bytes);
  // Headers of an answer before the last one: of a redirect, or of an attempt that goes again.
  void forgetHeaders() { response_ = {}; }
  // All of it; it counts no more.
  void clear();

  [[nodiscard]] const URLResponse& response() const { return response_; }
  [[nodiscard]] URLResponse takeResponse() { return std::move(response_); }
  void setResponse(URLResponse response) { response_ = std::move(response); }
  // The body, which goes on counting until giveBack().
  [[nodiscard]] Data takeBody();
  void giveBack();

 private:
  [[nodiscard]] bool hasRoomFor(size_t bodyBytes);
  OutstandingBytes::User& user_;
  std::string body_;
  size_t headerBytes_ = 0;
  size_t charge_ = 0;
  URLResponse response_;
};

}  // namespace kyt
