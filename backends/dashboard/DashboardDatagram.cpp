#include "backends/dashboard/DashboardDatagram.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

namespace kyt {

void DashboardDatagram::put(size_t offset, uint64_t number, size_t width) {
  for (size_t i = 0; i < width; ++i)
    bytes_[offset + i] = static_cast<std::byte>(number >> (8 * (width - 1 - i)));
}

// The session, the client's version and the length are complemented: receivers complement them back.
void DashboardDatagram::fill(const Header& header) {
  put(0, header.selfVersionMajor, 1);
  put(1, header.clientType, 1);
  put(2, 1, 1);
  put(3, static_cast<uint64_t>(header.time.microseconds / kTimeUnit), 1);
  put(4, static_cast<uint64_t>(header.time.seconds), 4);
  put(8, static_cast<uint32_t>(~header.sessionID), 4);
  put(12, static_cast<uint16_t>(~header.clientVersion), 2);
  put(16, header.method, 2);
  put(18, header.respCode, 2);
  // No terminator; a shorter identifier leaves zeros behind it.
  std::memcpy(bytes_.data() + 20, header.udid, strnlen(header.udid, kDeviceSize));
  put(kEventIDOffset, header.eventID, 2);
  put(62, header.flags, 2);
}

void DashboardDatagram::appendPair(const char* key, const char* value) {
  char soFar[kTextSize];
  std::memcpy(soFar, text(), textLength_ + 1);
  const int whole = std::snprintf(text(), kTextSize, "%s %s=%s", soFar, key, value);
  textLength_ = std::min(static_cast<size_t>(std::max(whole, 0)), kTextSize - 1);
}

void DashboardDatagram::finish() {
  put(14, static_cast<uint16_t>(~length()), 2);
}

uint16_t DashboardDatagram::number16(const std::byte* bytes) {
  return static_cast<uint16_t>(std::to_integer<unsigned>(bytes[0]) << 8 |
                               std::to_integer<unsigned>(bytes[1]));
}

uint32_t DashboardDatagram::number32(const std::byte* bytes) {
  return static_cast<uint32_t>(number16(bytes)) << 16 | number16(bytes + 2);
}

}  // namespace kyt
