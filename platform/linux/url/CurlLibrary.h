// The functions of libcurl, and those of libssl that its connections' TLS settings need, loaded by the
// network thread when the first request comes: libcurl brings some thirty other libraries along, which a
// daemon without sessions must not hold in memory. Network thread only.
#pragma once

#include <curl/curl.h>

#include <optional>
#include <string>
#include <variant>

struct ssl_ctx_st;
struct ssl_st;
struct x509_store_st;

// The one table of libcurl's functions: what each is called here, and there.
#define KYT_CURL_FUNCTIONS(ROW)                    \
  ROW(globalInit, curl_global_init)                \
  ROW(globalCleanup, curl_global_cleanup)          \
  ROW(easyInit, curl_easy_init)                    \
  ROW(easyCleanup, curl_easy_cleanup)              \
  ROW(easySetOption, curl_easy_setopt)             \
  ROW(easyGetInfo, curl_easy_getinfo)              \
  ROW(easyErrorText, curl_easy_strerror)           \
  ROW(multiInit, curl_multi_init)                  \
  ROW(multiCleanup, curl_multi_cleanup)            \
  ROW(multiSetOption, curl_multi_setopt)           \
  ROW(multiAdd, curl_multi_add_handle)             \
  ROW(multiRemove, curl_multi_remove_handle)       \
  ROW(multiReadInfo, curl_multi_info_read)         \
  ROW(multiSocketAction, curl_multi_socket_action) \
  ROW(shareInit, curl_share_init)                  \
  ROW(shareSetOption, curl_share_setopt)           \
  ROW(shareCleanup, curl_share_cleanup)

namespace kyt {

struct CurlLibrary {
  // Loads and initialises it, or says why that failed.
  [[nodiscard]] static std::variant<CurlLibrary, std::string> load(const char* name);

// NOLINTNEXTLINE(bugprone-macro-parentheses): a name that is declared cannot stand in parentheses
#define ROW(here, there) decltype(::there)* here = nullptr;
  KYT_CURL_FUNCTIONS(ROW)
#undef ROW
  void (*setCertificateStore)(ssl_ctx_st*, x509_store_st*) = nullptr;
  void (*chosenProtocol)(const ssl_st*, const unsigned char** name, unsigned* size) = nullptr;

  // Whether the connection that the handle's request goes on speaks HTTP/2. While it is being sent.
  [[nodiscard]] bool speaksHTTP2(CURL* handle) const;
};

}  // namespace kyt
