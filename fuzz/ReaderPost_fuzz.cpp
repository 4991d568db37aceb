// A message of the log, which anybody who reaches the log may have written, as the reader makes a text of it for the database.
// The first byte chooses the encoding that it claims, and whether it is compressed here. What is checked besides memory: a
// text has no zero byte and is within its limit, or there is a reason; and what was compressed here is read as it was.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "fuzz/Gzipped.h"
#include "reader/Post.h"

namespace {

using namespace kyt::reader;

void require(bool condition) {
  if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const std::string_view bytes(reinterpret_cast<const char*>(data) + 1, size - 1);
  const bool isCompressedHere = (data[0] & 4) != 0;
  Post post;
  post.encoding = isCompressedHere || (data[0] & 1) != 0 ? "gzip" : (data[0] & 2) != 0 ? "br" : "identity";
  post.body = isCompressedHere ? kyt::fuzz::gzipped(bytes) : std::string(bytes);
  const auto result = textOf(post);
  if (const auto* unreadable = std::get_if<Unreadable>(&result)) {
    require(!unreadable->reason.empty());
    require(!isCompressedHere || bytes.find('\0') != std::string_view::npos);
    return 0;
  }
  const auto& text = std::get<std::string>(result);
  require(text.size() <= kMostText && text.find('\0') == std::string::npos);
  require(!isCompressedHere || text == bytes);
  return 0;
}
