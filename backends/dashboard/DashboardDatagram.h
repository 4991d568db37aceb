// One event as it travels to a dashboard server: a header of 64 bytes, then a text of key=value pairs. The
// format is told in docs/WIRE-DASHBOARD.md; all fields of several bytes are big-endian.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/base/Clock.h"

namespace kyt {

class DashboardDatagram {
 public:
  static constexpr size_t kHeaderSize = 64;
  static constexpr size_t kTextSize = 1024;  // its terminator included, which is not sent
  static constexpr size_t kSize = kHeaderSize + kTextSize;
  static constexpr size_t kDeviceSize = 40;
  static constexpr size_t kEventIDOffset = 60;  // in acknowledgements too
  static constexpr uint16_t kFlagReliable = 1;
  static constexpr uint16_t kFlagWithoutProfile = 2;
  static constexpr int32_t kTimeUnit = 4000;  // microseconds

  struct Header {
    uint8_t selfVersionMajor = 0, clientType = 0;
    TimeValue time;
    uint32_t sessionID = 0;
    uint16_t clientVersion = 0, method = 0, respCode = 0, eventID = 0, flags = 0;
    const char* udid = "";
  };

  // Everything but the length, which appendPair() and finish() keep.
  void fill(const Header& header);
  // A blank, the key, an equals sign, the value; what has no room is cut.
  void appendPair(const char* key, const char* value);
  void finish();  // writes the length

  [[nodiscard]] uint16_t length() const { return static_cast<uint16_t>(kHeaderSize + textLength_); }
  [[nodiscard]] const std::byte* bytes() const { return bytes_.data(); }

  // Of any bytes in which there is room for them.
  [[nodiscard]] static uint16_t number16(const std::byte* bytes);
  [[nodiscard]] static uint32_t number32(const std::byte* bytes);

 private:
  void put(size_t offset, uint64_t number, size_t width);
  [[nodiscard]] char* text() { return reinterpret_cast<char*>(bytes_.data() + kHeaderSize); }
  std::array<std::byte, kSize> bytes_{};
  size_t textLength_ = 0;
};

}  // namespace kyt
