// The reference of the resident size: a program that initialises libcurl and waits.
#include <curl/curl.h>
#include <unistd.h>

int main() {
  if (curl_global_init(CURL_GLOBAL_DEFAULT) != CURLE_OK) return 1;
  CURLM* multi = curl_multi_init();
  pause();
  curl_multi_cleanup(multi);
}
