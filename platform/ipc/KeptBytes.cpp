#include "platform/ipc/KeptBytes.h"

#include <cstring>

#include "platform/base/Limits.h"

namespace kyt {

size_t KeptBytes::copyTo(std::span<std::byte> buffer) const {
  if (bytes_.size() > buffer.size() / 2) return 0;
  std::memcpy(buffer.data(), bytes_.data(), bytes_.size());
  return bytes_.size();
}

bool KeptBytes::append(std::span<const std::byte> read) {
  if (!charge_.set(bytes_.size() + read.size())) return false;
  bytes_.append(reinterpret_cast<const char*>(read.data()), read.size());
  return true;
}

bool KeptBytes::keep(std::span<const std::byte> rest) {
  if (rest.empty()) {
    clear();
    return true;
  }
  if (!charge_.set(rest.size() > Limits::freeBytes ? rest.size() : 0)) return false;
  bytes_ = std::string(reinterpret_cast<const char*>(rest.data()), rest.size());
  return true;
}

void KeptBytes::clear() {
  bytes_ = std::string();
  needed_ = 0;
  charge_.clear();
}

}  // namespace kyt
