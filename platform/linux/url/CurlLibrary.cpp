#include "platform/linux/url/CurlLibrary.h"

#include "platform/linux/base/SharedLibrary.h"

namespace kyt {
namespace {

constexpr char kSSLLibrary[] = "libssl.so.3";  // the one that libcurl itself has loaded

}  // namespace

std::variant<CurlLibrary, std::string> CurlLibrary::load(const char* name) {
  SharedLibrary curl(name);
  CurlLibrary functions;
  curl.resolve(functions.globalInit, "curl_global_init");
  curl.resolve(functions.globalCleanup, "curl_global_cleanup");
  curl.resolve(functions.easyInit, "curl_easy_init");
  curl.resolve(functions.easyCleanup, "curl_easy_cleanup");
  curl.resolve(functions.easySetOption, "curl_easy_setopt");
  curl.resolve(functions.easyGetInfo, "curl_easy_getinfo");
  curl.resolve(functions.easyErrorText, "curl_easy_strerror");
  curl.resolve(functions.multiInit, "curl_multi_init");
  curl.resolve(functions.multiCleanup, "curl_multi_cleanup");
  curl.resolve(functions.multiSetOption, "curl_multi_setopt");
  curl.resolve(functions.multiAdd, "curl_multi_add_handle");
  curl.resolve(functions.multiRemove, "curl_multi_remove_handle");
  curl.resolve(functions.multiReadInfo, "curl_multi_info_read");
  curl.resolve(functions.multiSocketAction, "curl_multi_socket_action");
  if (curl.problem()) return *curl.problem();
  SharedLibrary ssl(kSSLLibrary);
  ssl.resolve(functions.setCertificateStore, "SSL_CTX_set1_cert_store");
  if (ssl.problem()) return *ssl.problem();
  const CURLcode code = functions.globalInit(CURL_GLOBAL_DEFAULT);
  if (code != CURLE_OK) return std::string(name) + ": " + functions.easyErrorText(code);
  return functions;
}

}  // namespace kyt
