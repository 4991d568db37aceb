#include "devserver/Uploads.h"

#include <algorithm>
#include <string>
#include <system_error>
#include <variant>

#include "devserver/Files.h"
#include "devserver/PostChecker.h"
#include "devserver/Text.h"
#include "http/Gzip.h"

namespace kyt::devserver {
namespace {

constexpr size_t kLongestName = 200;

// Whether the text may name a file or a folder: it stays in the folder that it is appended to.
bool isName(std::string_view text) {
  if (text.empty() || text.size() > kLongestName || text == "." || text == "..") return false;
  return std::none_of(text.begin(), text.end(),
                      [](char c) { return c == '/' || static_cast<unsigned char>(c) < ' ' || c == 0x7f; });
}

}  // namespace

void Uploads::keep(const Request& request, Post& post) const {
  const auto argument = [&](const char* name) { return std::string(request.argument(name).value_or("")); };
  const std::string device = argument("uuid"), sequence = argument("sequence");
  std::string name = argument("filename");
  post.sender = "upload";
  post.client = validText(name);
  post.service = validText(device);
  if (name.ends_with(".gz")) name.resize(name.size() - 3);
  for (const auto& [key, value] :
       {std::pair("uuid", device), std::pair("sequence", sequence), std::pair("filename", name)}) {
    if (isName(value)) continue;
    post.reason = std::string("\"") + key + "\" is missing or names no file";
    return;
  }
  const std::string* encoding = findHeader(post.headers, "Content-Encoding");
  if (encoding == nullptr || !equalIgnoringCase(*encoding, "gzip")) {
    post.reason = "Content-Encoding is not gzip";
    return;
  }
  const auto contents = http::gunzip(post.body, maxInflatedBytes_);
  if (const auto* wrong = std::get_if<http::GzipError>(&contents)) {
    post.reason = wrong->reason;
    return;
  }
  post.textSize = std::get<std::string>(contents).size();
  const std::filesystem::path folder = folder_ / device / sequence;
  std::error_code failed;
  std::filesystem::create_directories(folder, failed);
  post.good = replaceFile(folder / name, std::get<std::string>(contents), 0600);
  if (!post.good) post.reason = "the file can't be kept";
}

}  // namespace kyt::devserver
