// One event as it travels to a dashboard server: a header of 64 bytes, then a text of key=value pairs. The
// format is told in docs/WIRE-DASHBOARD.md; all fields of several bytes are big-endian.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

#include "platform/base/Clock.h"

namespace kyt {

class DashboardDatagram {
 public:
  static constexpr size_t kHeaderSize = 64;
  static constexpr size_t kTextSize = 1024;  // its terminator included, which is not sent
  static constexpr size_t kSize = kHeaderSize + kTextSize;
  static constexpr uint16_t kFlagReliable = 1;
  static constexpr uint16_t kFlagWithoutProfile = 2;

  struct Header {
    uint8_t selfVersionMajor = 0, clientType = 0;
    TimeValue time;  // read back it has seconds of 32 bits, and steps of four milliseconds
    uint32_t sessionID = 0;
    uint16_t clientVersion = 0, method = 0, respCode = 0, eventID = 0, flags = 0;
    std::string_view udid;  // at most 40 bytes are sent
  };

  // Everything but the length, which appendPair() and finish() keep.
  void fill(const Header& header);
  // A blank, the key, an equals sign, the value; what has no room is cut.
  void appendPair(const char* key, const char* value);
  void finish();  // writes the length

  [[nodiscard]] uint16_t length() const { return static_cast<uint16_t>(kHeaderSize + textLength_); }
  [[nodiscard]] const std::byte* bytes() const { return bytes_.data(); }
  // What stands in it; the texts are valid as long as the datagram.
  [[nodiscard]] Header header() const;
  [[nodiscard]] const char* text() const {
    return reinterpret_cast<const char*>(bytes_.data() + kHeaderSize);
  }

  // The number of the event that an acknowledgement is about. Nothing else of one is looked at, and what is too short to
  // hold a number is none.
  [[nodiscard]] static std::optional<uint16_t> acknowledgedEvent(std::span<const std::byte> received);

 private:
  struct Field;
  struct Fields;
  void put(const Field& field, uint64_t number);
  [[nodiscard]] uint32_t number(const Field& field) const;
  [[nodiscard]] char* writableText() { return reinterpret_cast<char*>(bytes_.data() + kHeaderSize); }
  std::array<std::byte, kSize> bytes_{};
  size_t textLength_ = 0;
};

}  // namespace kyt
