#include "platform/linux/url/ReceivedReply.h"

#include <algorithm>
#include <charconv>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/linux/url/HeaderLines.h"

namespace kyt {
namespace {

constexpr size_t kMaxReplyHeaderBytes = 256u << 10;

std::string_view trim(std::string_view text) {
  const size_t first = text.find_first_not_of(" \t\r\n");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t\r\n") - first + 1);
}

std::string withoutControls(std::string_view text) {
  std::string result(text);
  std::erase_if(result, isControl);
  return result;
}

// Of a line as in "HTTP/1.1 200 OK"; 0 of one that is only preliminary.
int statusOf(std::string_view line) {
  int status = 0;
  line.remove_prefix(std::min(line.find(' '), line.size()));
  line.remove_prefix(std::min(line.find_first_not_of(' '), line.size()));
  (void)std::from_chars(line.data(), line.data() + line.size(), status);
  return status >= 200 ? status : 0;
}

}  // namespace

ReceivedReply::Taken ReceivedReply::takeHeader(std::string_view line) {
  headerBytes_ += line.size();
  if (headerBytes_ > kMaxReplyHeaderBytes) return Taken::tooLong;
  if (line.starts_with("HTTP/")) {  // a redirect's or an interim reply's headers are forgotten
    response_ = {statusOf(line), {}};
    return Taken::yes;
  }
  const bool isTrailer = !body_.empty();
  const size_t colon = line.find(':');
  if (isTrailer || colon == std::string_view::npos || colon == 0) return Taken::yes;
  if (line.front() == ' ' || line.front() == '\t') return Taken::yes;
  response_.headers.emplace_back(withoutControls(trim(line.substr(0, colon))),
                                 withoutControls(trim(line.substr(colon + 1))));
  return Taken::yes;
}

ReceivedReply::Taken ReceivedReply::takeBody(std::string_view bytes) {
  const size_t length = body_.size() + bytes.size();
  if (length > Limits::maxHTTPReplyBytes) return Taken::tooLong;
  if (!hasRoomFor(length)) return Taken::noRoom;
  body_.append(bytes);
  return Taken::yes;
}

// Mostly what a request counts covers its reply too. What is more counts in large steps.
bool ReceivedReply::hasRoomFor(size_t bodyBytes) {
  constexpr size_t kStep = 65536;
  const size_t covered = Limits::freeBytes + charge_;
  if (bodyBytes <= covered) return true;
  const size_t more = std::max(kStep, bodyBytes - covered);
  if (!user_.takeReply(more)) return false;
  charge_ += more;
  return true;
}

Data ReceivedReply::takeBody() {
  Data data{std::string_view(body_)};
  body_ = {};
  return data;
}

void ReceivedReply::clear() {
  body_ = {};
  giveBack();
  response_ = {};
  headerBytes_ = 0;
}

void ReceivedReply::giveBack() {
  if (charge_ != 0) user_.giveReplyBack(std::exchange(charge_, 0));
}

}  // namespace kyt
