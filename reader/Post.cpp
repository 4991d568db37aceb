#include "reader/Post.h"

#include "http/Gzip.h"

namespace kyt::reader {

std::variant<std::string, Unreadable> textOf(const Post& post) {
  if (!post.problem.empty()) return Unreadable{post.problem};
  std::string text = post.body;
  if (post.encoding == "gzip") {
    auto inflated = http::gunzip(post.body, kMostText);
    if (const auto* error = std::get_if<http::GzipError>(&inflated)) return Unreadable{error->reason};
    text = std::get<std::string>(std::move(inflated));
  } else if (post.encoding != "identity") {
    return Unreadable{"unknown encoding \"" + post.encoding + "\""};
  }
  // The database's texts end at such a byte.
  if (text.find('\0') != std::string::npos) return Unreadable{"a zero byte"};
  return text;
}

}  // namespace kyt::reader
