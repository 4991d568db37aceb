#include "platform/linux/url/CurlLibrary.h"

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
  if (ssl.problem()) return *ssl.problem();
  const CURLcode code = functions.globalInit(CURL_GLOBAL_DEFAULT);
  if (code != CURLE_OK) return std::string(name) + ": " + functions.easyErrorText(code);
  return functions;
}

}  // namespace kyt
