#include "platform/linux/url/CurlLibrary.h"

#include <string_view>

#include "platform/linux/base/SharedLibrary.h"

namespace kyt {
namespace {

constexpr char kSSLLibrary[] = "libssl.so.3";  // the one that libcurl itself has loaded

}  // namespace

std::variant<CurlLibrary, std::string> CurlLibrary::load(const char* name) {
  SharedLibrary curl(name);
  CurlLibrary functions;
#define ROW(here, there) curl.resolve(functions.here, #there);
  KYT_CURL_FUNCTIONS(ROW)
#undef ROW
  if (curl.problem()) return *curl.problem();
  SharedLibrary ssl(kSSLLibrary);
  ssl.resolve(functions.setCertificateStore, "SSL_CTX_set1_cert_store");
  ssl.resolve(functions.chosenProtocol, "SSL_get0_alpn_selected");
  if (ssl.problem()) return *ssl.problem();
  const CURLcode code = functions.globalInit(CURL_GLOBAL_DEFAULT);
  if (code != CURLE_OK) return std::string(name) + ": " + functions.easyErrorText(code);
  return functions;
}

bool CurlLibrary::speaksHTTP2(CURL* handle) const {
  curl_tlssessioninfo* tls = nullptr;
  if (easyGetInfo(handle, CURLINFO_TLS_SSL_PTR, &tls) != CURLE_OK || tls == nullptr) return false;
  if (tls->backend != CURLSSLBACKEND_OPENSSL || tls->internals == nullptr) return false;
  const unsigned char* name = nullptr;
  unsigned size = 0;
  chosenProtocol(static_cast<const ssl_st*>(tls->internals), &name, &size);
  return std::string_view(reinterpret_cast<const char*>(name), size) == "h2";
}

}  // namespace kyt
