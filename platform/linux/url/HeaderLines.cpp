#include "platform/linux/url/HeaderLines.h"

#include <strings.h>

#include <algorithm>
#include <cstring>
#include <iterator>

namespace kyt {
namespace {

bool sameName(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

}  // namespace

void HeaderLines::make(const std::vector<std::pair<std::string, std::string>>& headers,
                       const std::string& source) {
  size_t bytes = 128 + source.size();
  for (const auto& [name, value] : headers) bytes += name.size() + value.size() + 3;
  text_.reserve(bytes);
  bool hasAccept = false, hasType = false;
  for (const auto& [name, value] : headers) {
    hasAccept = hasAccept || sameName(name, "Accept");
    hasType = hasType || sameName(name, "Content-Type");
    add(name, value);
  }
  if (!source.empty()) add("X-KYT-Source-Application", source);
  // A name with nothing after its colon takes libcurl's own header away.
  for (const auto& [suppressed, wanted] :
       {std::pair("Expect:", true), std::pair("Accept:", !hasAccept), std::pair("Content-Type:", !hasType)}) {
    if (wanted) text_.append(suppressed).push_back('\0');
  }
  link();
}

void HeaderLines::link() {
  list_.resize(static_cast<size_t>(std::count(text_.begin(), text_.end(), '\0')));
  char* line = text_.data();
  for (size_t i = 0; i < list_.size(); ++i) {
    list_[i] = {line, i + 1 < list_.size() ? &list_[i + 1] : nullptr};
    line += std::strlen(line) + 1;
  }
}

void HeaderLines::add(std::string_view name, std::string_view value) {
  const auto isForbiddenInName = [](char c) { return isControl(c) || c == ':' || c == ' '; };
  if (std::all_of(name.begin(), name.end(), isForbiddenInName)) return;
  std::copy_if(name.begin(), name.end(), std::back_inserter(text_),
               [&](char c) { return !isForbiddenInName(c); });
  const bool isEmpty =
      std::all_of(value.begin(), value.end(), [](char c) { return isControl(c) || c == ' '; });
  if (isEmpty) {
    text_.push_back(';');  // how libcurl is told of a header without a value
  } else {
    text_.append(": ");
    std::copy_if(value.begin(), value.end(), std::back_inserter(text_), [](char c) { return !isControl(c); });
  }
  text_.push_back('\0');
}

}  // namespace kyt
