// The facts of a post, which its message carries on: from strangers' headers.
#include <gtest/gtest.h>

#include <string>

#include "receiver/Limits.h"
#include "receiver/PostCheck.h"

namespace kyt::receiver {
namespace {

// What a message says of its sender where the header is this.
std::string senderOf(const std::string& header) {
  http::Request request;
  request.path = "/v1/events";
  request.headers = {{"X-KYT-Sender", header}};
  for (const auto& [name, value] : factsOf(request, "", 0, false))
    if (name == "Kyt-Sender") return value;
  return "none";
}

TEST(PostFacts, AreTextAsItCame) {
  EXPECT_EQ(senderOf("QPW"), "QPW");
  EXPECT_EQ(senderOf("Größe \\ \"7\""), "Größe \\ \"7\"");
  EXPECT_EQ(senderOf(""), "none");
}

TEST(PostFacts, SteerNoTerminalAndAreOneLine) {
  EXPECT_EQ(senderOf("a\x1b[2J\x7f"), "a\\x1b[2J\\x7f");
  EXPECT_EQ(senderOf("a\xff"), "a\\xff");
  EXPECT_EQ(senderOf("a\u009b2Jb"), "a\\xc2\\x9b2Jb") << "a control character of two bytes";
  EXPECT_EQ(senderOf("a\u2028b\u202e"), "a\\xe2\\x80\\xa8b\\xe2\\x80\\xae") << "a line's end, and reversal";
}

TEST(PostFacts, AreCutToTheirLimit) {
  EXPECT_EQ(senderOf(std::string(1000, 'a')), std::string(Limits::maxFactBytes, 'a'));
}

}  // namespace
}  // namespace kyt::receiver
