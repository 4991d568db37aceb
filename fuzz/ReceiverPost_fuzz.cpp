// A post as a stranger sends it: what the receiver makes of its headers, its digest and its body, opened and not. The first
// byte chooses the method, the path's rule for digests and whether the body is compressed here; lines "NAME: VALUE" up to an
// empty one are headers; the rest is the body. What is checked besides memory: each refusal has a status that silences no
// device, what a message carries on is plain text within its limit, and a body that is opened as it is inflated is judged as
// one that was inflated before.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "fuzz/Gzipped.h"
#include "http/Gzip.h"
#include "platform/base/TextEscape.h"
#include "receiver/JSONCheck.h"
#include "receiver/Limits.h"
#include "receiver/PostCheck.h"

namespace kyt::receiver {
namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

Settings settingsOf(DigestPolicy policy) {
  Settings settings;
  PathSettings& path = settings.paths.emplace_back();
  path.urlPath = "/v1/events";
  path.digest = policy;
  path.digestKeys["QPW/person"] = {"one key", "another"};
  return settings;
}

http::Request requestOf(uint8_t flags, std::string_view text) {
  http::Request request;
  request.method = (flags & 1) != 0 ? "GET" : "POST";
  request.path = (flags & 2) != 0 ? "/v1/other" : "/v1/events";
  while (!text.empty()) {
    const size_t end = std::min(text.find('\n'), text.size());
    const std::string_view line = text.substr(0, end);
    text.remove_prefix(std::min(end + 1, text.size()));
    if (line.empty()) break;
    const size_t colon = line.find(": ");
    if (colon != std::string_view::npos)
      request.headers.push_back({std::string(line.substr(0, colon)), std::string(line.substr(colon + 2))});
  }
  request.body = (flags & 4) != 0 ? fuzz::gzipped(text) : std::string(text);
  if ((flags & 8) == 0) request.contentLength = request.body.size();
  return request;
}

void judge(const http::Request& request, DigestPolicy policy) {
  const Settings settings = settingsOf(policy);
  const PostCheck check(settings);
  bool hasDigest = false;
  for (const auto& rejection : {check.rejectionByHeaders(request), check.rejection(request, hasDigest)})
    if (rejection) require(rejection->status >= 400 && rejection->status < 500 && !rejection->text.empty());
  require(!hasDigest || policy != DigestPolicy::none);
  for (const auto& [name, value] : factsOf(request, messageID(request.body), 1, hasDigest)) {
    require(name.starts_with("Kyt-") && !value.empty() && isPlainText(value));
    require(value.size() <= 4 * Limits::maxFactBytes);  // a byte that is no text stands there as \xNN
  }
}

void open(const std::string& body) {
  const bool isGood = !problemOfPost(body, true);
  const auto inflated = http::gunzip(body, mostInflatedBytes(body.size()));
  const auto* text = std::get_if<std::string>(&inflated);
  require(isGood == (text != nullptr && !problemOfPost(*text, false)));
}

}  // namespace
}  // namespace kyt::receiver

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace kyt::receiver;
  if (size == 0) return 0;
  const auto request = requestOf(data[0], {reinterpret_cast<const char*>(data) + 1, size - 1});
  judge(request, static_cast<DigestPolicy>((data[0] >> 4) % 3));
  open(request.body);
  return 0;
}
