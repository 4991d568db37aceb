// zlib's deflate behind the port.
#pragma once

#include "platform/Deflate.h"

namespace kyt {

class ZlibDeflate : public Deflate {
 public:
  [[nodiscard]] std::unique_ptr<DeflateStream> newStream() override;
};

}  // namespace kyt
