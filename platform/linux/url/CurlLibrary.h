// The functions of libcurl, and the one of libssl that its connections' TLS settings need, loaded by the
// network thread when the first request comes: libcurl brings some thirty other libraries along, which a
// daemon without sessions must not hold in memory. Network thread only.
#pragma once

#include <curl/curl.h>

#include <optional>
#include <string>
#include <variant>

struct ssl_ctx_st;
struct x509_store_st;

namespace kyt {

struct CurlLibrary {
  // Loads and initialises it, or says why that failed.
  [[nodiscard]] static std::variant<CurlLibrary, std::string> load(const char* name);

  decltype(::curl_global_init)* globalInit = nullptr;
  decltype(::curl_global_cleanup)* globalCleanup = nullptr;
  decltype(::curl_easy_init)* easyInit = nullptr;
  decltype(::curl_easy_cleanup)* easyCleanup = nullptr;
  decltype(::curl_easy_setopt)* easySetOption = nullptr;
  decltype(::curl_easy_getinfo)* easyGetInfo = nullptr;
  decltype(::curl_easy_strerror)* easyErrorText = nullptr;
  decltype(::curl_multi_init)* multiInit = nullptr;
  decltype(::curl_multi_cleanup)* multiCleanup = nullptr;
  decltype(::curl_multi_setopt)* multiSetOption = nullptr;
  decltype(::curl_multi_add_handle)* multiAdd = nullptr;
  decltype(::curl_multi_remove_handle)* multiRemove = nullptr;
  decltype(::curl_multi_info_read)* multiReadInfo = nullptr;
  decltype(::curl_multi_socket_action)* multiSocketAction = nullptr;
  void (*setCertificateStore)(ssl_ctx_st*, x509_store_st*) = nullptr;
};

}  // namespace kyt
