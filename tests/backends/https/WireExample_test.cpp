// Sends the worked example of docs/WIRE-HTTPS.md and compares what is posted with the document.
#include <openssl/evp.h>
#include <openssl/hmac.h>

#include <fstream>
#include <sstream>

#include "tests/backends/https/HTTPSFixture.h"

namespace kyt {
namespace {

class WireExample : public HTTPSFixture {
 protected:
  // The text of the fenced block with that label.
  static std::string block(const std::string& label) {
    std::ifstream file(KYT_DOCS_DIR "/WIRE-HTTPS.md");
    std::ostringstream text;
    text << file.rdbuf();
    const std::string document = text.str();
    const std::string fence = "```" + label + "\n";
    const size_t start = document.find(fence);
    if (start == std::string::npos) return {};
    const size_t begin = start + fence.size();
    return document.substr(begin, document.find("\n```", begin) - begin);
  }
  Dictionary dictionaryBlock(const std::string& label) {
    const std::variant<Value, Error> parsed = platform_.json.parse(block(label));
    const Value* value = std::get_if<Value>(&parsed);
    EXPECT_TRUE(value != nullptr && value->isDictionary()) << label;
    return value != nullptr && value->isDictionary() ? *value->dictionary() : Dictionary();
  }
  std::string postedHeaders() const {
    std::string text;
    for (const auto& [name, value] : poster_->requests.at(0).headers) {
      if (!text.empty()) text += '\n';
      text += name + ": " + value;
    }
    return text;
  }
};

TEST_F(WireExample, IsWhatIsPosted) {
  const std::string key("a digest key");
  entry_ = dictionaryBlock("json entry");
  userInfo_ = dictionaryBlock("json userinfo");
  platform_.deviceProperties.setSecondsFromGMT(3600);
  facts_.batchEvents = false;
  facts_.setStartTimestamp({1000000123, 900000});
  HTTPSPostBackend& example = backend();
  example.setCorrelatedSessionID("12.77");
  example.setDigestKey(Data(std::string_view(key)));
  example.updateState();
  platform_.deflate.faults.initialize = -4;  // so that the example can be read
  platform_.clock.setTimeOfDay({1000000130, 250000});

  example.sendMessage({{kKYTReportingMessageBlobClientData, dictionaryBlock("json payload")},
                       {kKYTReportingMessageBlobSharedData, dictionaryBlock("json shareddata")}},
                      {1000000129, 400000}, 5, 2, MessageFlag{0});

  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(poster_->requests[0].url, "https://post.example.org/events");
  EXPECT_EQ(poster_->requests[0].body.view(), block("json message"));
  EXPECT_EQ(postedHeaders(), block("http request"));
}

// The digest in the document, of the message in the document, by OpenSSL itself.
TEST_F(WireExample, ItsDigestIsRight) {
  const std::string key("a digest key");
  const std::string body = block("json message");
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned length = 0;
  HMAC(EVP_sha1(), key.data(), static_cast<int>(key.size()),
       reinterpret_cast<const unsigned char*>(body.data()), body.size(), digest, &length);
  std::string expected("X-KYT-DIGEST: <");
  for (unsigned i = 0; i < length; ++i) {
    char digits[4];
    std::snprintf(digits, sizeof digits, "%02x", digest[i]);
    if (i != 0 && i % 4 == 0) expected += ' ';
    expected += digits;
  }
  EXPECT_NE(block("http request").find(expected + ">"), std::string::npos) << expected;
}

}  // namespace
}  // namespace kyt
