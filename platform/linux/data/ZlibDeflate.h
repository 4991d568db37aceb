// zlib's deflate behind the port.
//
// A stream needs some 270 KiB, which the allocator would map, fault in and give back to the kernel for each
// request body: a third of the cost of posting. So the workspaces of ended streams are kept for the next
// ones, few, since that many bodies are rarely compressed at the same moment.
#pragma once

#include <cstddef>
#include <memory>

#include "platform/Deflate.h"
#include "platform/linux/data/Spares.h"

namespace kyt {

class ZlibDeflate : public Deflate {
 public:
  static constexpr size_t kWorkspaceBytes = 288u << 10;  // what the usual settings take, and some room
  static constexpr size_t kMostKept = 3;

  using Workspace = std::unique_ptr<std::byte[]>;

  // `level` is what kDeflateDefaultLevel stands for: 1 to 9.
  explicit ZlibDeflate(int level = 6) : level_(level) {}
  ZlibDeflate(const ZlibDeflate&) = delete;
  ZlibDeflate& operator=(const ZlibDeflate&) = delete;
  ~ZlibDeflate() override = default;
  [[nodiscard]] std::unique_ptr<DeflateStream> newStream() override;
  [[nodiscard]] size_t kept() const { return workspaces_.kept(); }

 private:
  const int level_;
  Spares<Workspace> workspaces_{kMostKept};
};

}  // namespace kyt
