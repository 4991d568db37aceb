// A message of the log, which anybody who reaches the log may have written, as the reader makes a text of it for the database.
// The first byte chooses the encoding that it claims, and whether it is compressed here. What is checked besides memory: a
// text has no zero byte and is within its limit, or there is a reason; and what was compressed here is read as it was.
#include <zlib.h>

#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "reader/Post.h"

namespace {

using namespace kyt::reader;

void require(bool condition) {
  if (!condition) std::abort();
}

std::string gzipped(std::string_view text) {
  z_stream stream{};
  require(deflateInit2(&stream, Z_BEST_SPEED, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY) == Z_OK);
  std::string out(deflateBound(&stream, text.size()) + 32, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  require(deflate(&stream, Z_FINISH) == Z_STREAM_END);
  out.resize(stream.total_out);
  deflateEnd(&stream);
  return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const std::string_view bytes(reinterpret_cast<const char*>(data) + 1, size - 1);
  const bool isCompressedHere = (data[0] & 4) != 0;
  Post post;
  post.encoding = isCompressedHere || (data[0] & 1) != 0 ? "gzip" : (data[0] & 2) != 0 ? "br" : "identity";
  post.body = isCompressedHere ? gzipped(bytes) : std::string(bytes);
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
