#include "platform/URLSession.h"

#include <algorithm>
#include <cctype>
#include <iterator>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"

namespace kyt {

std::optional<std::string> URLResponse::header(std::string_view name) const {
  const auto sameLetter = [](char a, char b) {
    return std::tolower(static_cast<unsigned char>(a)) == std::tolower(static_cast<unsigned char>(b));
  };
  std::optional<std::string> all;
  for (const auto& [key, value] : headers) {
    if (!std::equal(key.begin(), key.end(), name.begin(), name.end(), sameLetter)) continue;
    all = all ? *all + ", " + value : value;
  }
  return all;
}

bool mayHaveLeft(const std::optional<URLResponse>& response, const std::optional<Error>& error) {
  // libcurl's: no such address, no resolver, nobody listens, no common TLS, a certificate or a list of them that is wrong.
  constexpr int32_t kBeforeTheBody[] = {1,  3,  4,  5,  6,  7,  35, 53, 58, 59,
                                        60, 66, 77, 80, 82, 83, 90, 91, 96, 98};
  if (response || !error) return true;
  if (error->code == kURLErrorWaitingTooMuch || error->code == kURLErrorOutstandingTooMuch) return false;
  return std::find(std::begin(kBeforeTheBody), std::end(kBeforeTheBody), error->code) ==
         std::end(kBeforeTheBody);
}

URLReply startAndWait(URLRequest request, Function<void(URLRequest, URLCompletion)> start) {
  Semaphore done;
  URLReply reply;
  request.isAwaited = true;
  start(std::move(request),
        [&](std::optional<Data> data, std::optional<URLResponse> response, std::optional<Error> error) {
          reply = URLReply{std::move(data), std::move(response), std::move(error)};
          done.signal();
        });
  done.wait();
  return reply;
}

size_t countedBytes(const URLRequest& request) {
  constexpr size_t kRequestCost = 12288;  // measured: what libcurl keeps, however small the request is
  size_t bytes = kRequestCost + request.url.size() + request.body.size();
  for (const auto& [name, value] : request.headers) bytes += name.size() + value.size();
  return std::min(bytes, Limits::maxOutstandingBytes / 2);
}

}  // namespace kyt
