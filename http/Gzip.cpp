#include "http/Gzip.h"

#include <zlib.h>

namespace kyt::http {

std::variant<std::string, GzipError> gunzip(std::string_view bytes, uint64_t limit) {
  z_stream stream{};
  if (inflateInit2(&stream, 15 + 16) != Z_OK) return GzipError{"zlib can't start"};
  struct End {
    z_stream& stream;
    ~End() { inflateEnd(&stream); }
  } end{stream};
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
  stream.avail_in = static_cast<uInt>(bytes.size());
  std::string out;
  char block[65536];
  int result = Z_OK;
  while (result != Z_STREAM_END) {
    stream.next_out = reinterpret_cast<Bytef*>(block);
    stream.avail_out = sizeof block;
    result = inflate(&stream, Z_NO_FLUSH);
    const size_t produced = sizeof block - stream.avail_out;
    if (out.size() + produced > limit) {
      return GzipError{"the gzip body inflates to more than " + std::to_string(limit) + " bytes"};
    }
    out.append(block, produced);
    if (result == Z_BUF_ERROR || (result == Z_OK && produced == 0 && stream.avail_in == 0)) {
      return GzipError{"the gzip body ends early"};
    }
    if (result != Z_OK && result != Z_STREAM_END) {
      return GzipError{std::string("the body is no gzip: ") +
                       (stream.msg != nullptr ? stream.msg : "damaged")};
    }
  }
  if (stream.avail_in != 0) return GzipError{"bytes follow the end of the gzip body"};
  return out;
}

}  // namespace kyt::http
