// The header lines of one request, in the form in which libcurl takes them. Made once, and used by each attempt.
#pragma once

#include <curl/curl.h>

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace kyt {

class HeaderLines {
 public:
  // Control characters are left out, and in names colons and blanks too. `source`: the value of X-KYT-Source-Application;
  // empty: not sent.
  void make(const std::vector<std::pair<std::string, std::string>>& headers, const std::string& source);
  [[nodiscard]] bool empty() const { return list_.empty(); }
  // In bytes.
  [[nodiscard]] size_t size() const { return text_.size(); }
  // As long as this.
  [[nodiscard]] curl_slist* list() { return list_.data(); }

 private:
  void add(std::string_view name, std::string_view value);
  void link();
  std::string text_;              // all lines, each ended by a zero
  std::vector<curl_slist> list_;  // points into text_
};

// Of an ASCII control character.
[[nodiscard]] inline bool isControl(char c) {
  return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
}

}  // namespace kyt
