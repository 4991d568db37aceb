// zlib's deflate behind the port.
//
// A stream needs some 270 KiB, which the allocator would map, fault in and give back to the kernel for each
// request body: a third of the cost of posting. So the workspaces of ended streams are kept for the next
// ones, few, since that many bodies are rarely compressed at the same moment.
#pragma once

#include <memory>
#include <vector>

#include "platform/Deflate.h"
#include "platform/base/Mutex.h"

namespace kyt {

class ZlibDeflate : public Deflate {
 public:
  static constexpr size_t kWorkspaceBytes = 288u << 10;  // what the usual settings take, and some room
  static constexpr size_t kMostKept = 3;

  ZlibDeflate() = default;
  ZlibDeflate(const ZlibDeflate&) = delete;
  ZlibDeflate& operator=(const ZlibDeflate&) = delete;
  ~ZlibDeflate() override = default;  // no stream may be left
  [[nodiscard]] std::unique_ptr<DeflateStream> newStream() override;
  [[nodiscard]] size_t kept() const EXCLUDES(mutex_);

  using Workspace = std::unique_ptr<std::byte[]>;
  // For streams. Null when there is no memory.
  [[nodiscard]] Workspace takeWorkspace() EXCLUDES(mutex_);
  void giveBack(Workspace workspace) EXCLUDES(mutex_);

 private:
  mutable Mutex mutex_;
  std::vector<Workspace> workspaces_ GUARDED_BY(mutex_);
};

}  // namespace kyt
