#include "tools/demo/Http.h"

#include <curl/curl.h>

#include <memory>

namespace kyt::tools {

namespace {

struct Freer {
  void operator()(CURL* handle) const { curl_easy_cleanup(handle); }
};

size_t collect(char* bytes, size_t size, size_t count, void* out) {
  static_cast<std::string*>(out)->append(bytes, size * count);
  return size * count;
}

std::optional<HttpAnswer> perform(const std::string& url, const std::string* body, long seconds) {
  static const CURLcode initialized = curl_global_init(CURL_GLOBAL_DEFAULT);
  const std::unique_ptr<CURL, Freer> handle(initialized == CURLE_OK ? curl_easy_init() : nullptr);
  if (!handle) return std::nullopt;
  HttpAnswer answer;
  curl_easy_setopt(handle.get(), CURLOPT_URL, url.c_str());
  curl_easy_setopt(handle.get(), CURLOPT_PROXY, "");
  curl_easy_setopt(handle.get(), CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(handle.get(), CURLOPT_TIMEOUT, seconds);
  curl_easy_setopt(handle.get(), CURLOPT_WRITEFUNCTION, &collect);
  curl_easy_setopt(handle.get(), CURLOPT_WRITEDATA, &answer.body);
  if (body != nullptr) {
    curl_easy_setopt(handle.get(), CURLOPT_CUSTOMREQUEST, "PUT");
    curl_easy_setopt(handle.get(), CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body->size()));
    curl_easy_setopt(handle.get(), CURLOPT_POSTFIELDS, body->data());
  }
  if (curl_easy_perform(handle.get()) != CURLE_OK) return std::nullopt;
  curl_easy_getinfo(handle.get(), CURLINFO_RESPONSE_CODE, &answer.status);
  return answer;
}

}  // namespace

std::optional<HttpAnswer> httpGet(const std::string& url, long seconds) {
  return perform(url, nullptr, seconds);
}

std::optional<HttpAnswer> httpPut(const std::string& url, const std::string& body) {
  return perform(url, &body, 30);
}

}  // namespace kyt::tools
