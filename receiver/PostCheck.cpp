#include "receiver/PostCheck.h"

#include <openssl/sha.h>

#include <algorithm>

#include "http/PostDigest.h"
#include "http/Text.h"
#include "platform/base/Hex.h"
#include "platform/base/TextEscape.h"
#include "receiver/Limits.h"

namespace kyt::receiver {
namespace {

using http::Request;

std::string_view headerOf(const Request& request, std::string_view name) {
  const std::string* value = request.header(name);
  return value != nullptr ? std::string_view(*value) : std::string_view();
}

// A header's value as a message carries it: one line of text that steers no terminal, cut to its limit.
std::string factOf(const Request& request, std::string_view name) {
  return escapedText(headerOf(request, name).substr(0, Limits::maxFactBytes));
}

bool isThereTwice(const Request& request, std::string_view name) {
  return std::count_if(request.headers.begin(), request.headers.end(), [&](const http::Header& header) {
           return http::equalIgnoringCase(header.name, name);
         }) > 1;
}

bool isIdentity(std::string_view encoding) {
  return encoding.empty() || http::equalIgnoringCase(encoding, "identity");
}

}  // namespace

bool isGzip(const Request& request) {
  return !isIdentity(headerOf(request, "Content-Encoding"));
}

const PathSettings* PostCheck::pathOf(std::string_view urlPath) const {
  const auto found = std::find_if(settings_.paths.begin(), settings_.paths.end(),
                                  [&](const PathSettings& path) { return path.urlPath == urlPath; });
  return found == settings_.paths.end() ? nullptr : &*found;
}

std::optional<Rejection> PostCheck::rejectionByHeaders(const Request& request) const {
  if (pathOf(request.path) == nullptr) return Rejection{Refusal::unknownPath, 404, "no posts are taken here"};
  if (request.method != "POST") return Rejection{Refusal::wrongMethod, 405, "only posts are taken here"};
  if (!request.contentLength || request.header("Transfer-Encoding") != nullptr)
    return Rejection{Refusal::noLength, 411, "a post must say its length"};
  const std::string_view encoding = headerOf(request, "Content-Encoding");
  if ((!isIdentity(encoding) && !http::equalIgnoringCase(encoding, "gzip")) ||
      isThereTwice(request, "Content-Encoding"))
    return Rejection{Refusal::wrongEncoding, 415, "the body may be encoded with gzip alone"};
  return std::nullopt;
}

std::optional<Rejection> PostCheck::rejection(const Request& request, bool& hasDigest) const {
  if (request.tooLarge) return Rejection{Refusal::tooLarge, 413, "the body is too large"};
  if (request.noRoom) return Rejection{Refusal::bodiesFull, 429, "too much is being received"};
  const std::string_view body = request.body;
  if (body.empty()) return Rejection{Refusal::empty, 400, "the post is empty"};
  // The magic of gzip with its only method.
  if (isGzip(request) && !body.starts_with("\x1f\x8b\x08"))
    return Rejection{Refusal::notGzip, 400, "the body is no gzip"};
  const PathSettings* path = pathOf(request.path);
  return path == nullptr ? std::nullopt : rejectionOfDigest(*path, request, hasDigest);
}

std::optional<Rejection> PostCheck::rejectionOfDigest(const PathSettings& path, const Request& request,
                                                      bool& hasDigest) const {
  hasDigest = false;
  if (path.digest == DigestPolicy::none) return std::nullopt;
  const bool isRequired = path.digest == DigestPolicy::required;
  const std::string* digest = request.header("X-KYT-DIGEST");
  if (digest == nullptr) {
    if (!isRequired) return std::nullopt;
    return Rejection{Refusal::digestMissing, 400, "X-KYT-DIGEST is missing"};
  }
  std::string sender(headerOf(request, "X-KYT-Sender"));
  sender.append("/").append(headerOf(request, "X-KYT-Client-Name"));
  const auto keys = path.digestKeys.find(sender);
  if (keys == path.digestKeys.end()) {
    // Without a key nobody can say that it is wrong.
    if (!isRequired) return std::nullopt;
    return Rejection{Refusal::digestUnknownSender, 400, "no key of that sender and client is known"};
  }
  // Each key is tried, so that the time does not tell which one it was.
  for (const std::string& key : keys->second)
    hasDigest = http::digestFits(key, request.body, *digest) || hasDigest;
  if (hasDigest) return std::nullopt;
  return Rejection{Refusal::digestWrong, 400, "X-KYT-DIGEST does not fit the body and a known key"};
}

std::vector<std::pair<std::string, std::string>> factsOf(const Request& request, const std::string& id,
                                                         int64_t receivedMilliseconds, bool hasDigest) {
  std::vector<std::pair<std::string, std::string>> facts;
  facts.reserve(9);
  facts.emplace_back("Kyt-Id", id);
  facts.emplace_back("Kyt-Received", std::to_string(receivedMilliseconds));
  facts.emplace_back("Kyt-Path", escapedText(request.path));
  const auto add = [&](const char* name, const char* header) {
    if (std::string value = factOf(request, header); !value.empty())
      facts.emplace_back(name, std::move(value));
  };
  add("Kyt-Sender", "X-KYT-Sender");
  add("Kyt-Client", "X-KYT-Client-Name");
  add("Kyt-Service", "X-KYT-Service-Name");
  add("Kyt-Client-Version", "X-KYT-Client-Version");
  facts.emplace_back("Kyt-Encoding", isGzip(request) ? "gzip" : "identity");
  facts.emplace_back("Kyt-Digest", hasDigest ? "valid" : "absent");
  return facts;
}

std::string messageID(std::string_view body) {
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(body.data()), body.size(), digest);
  std::string text;
  text.reserve(2 * sizeof digest);
  for (const unsigned char byte : digest) appendHexByte(byte, text);
  return text;
}

}  // namespace kyt::receiver
