// Reads a datagram of the dashboard feed, as docs/WIRE-DASHBOARD.md tells it. Nothing in it is believed:
// whatever the bytes, the answer is a datagram or a reason. A pure function; any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace kyt::devserver {

struct Datagram {
  uint8_t selfVersionMajor = 0, clientType = 0;
  uint32_t seconds = 0;
  unsigned milliseconds = 0;
  uint32_t session = 0;
  uint16_t clientVersion = 0, method = 0, respCode = 0, event = 0, flags = 0;
  std::string device;
  std::string text;
  // What the text says, in its order. Keys are not escaped in it, so one with a blank or an equals sign is
  // read wrong.
  std::vector<std::pair<std::string, std::string>> pairs;

  static constexpr size_t kHeaderSize = 64, kMaxSize = 64 + 1023;
  static constexpr uint16_t kReliable = 1;
};

[[nodiscard]] std::variant<Datagram, std::string> readDatagram(std::string_view bytes);

// What the server sends back: the header alone, as it came, with this number in place of the event's.
// Precondition: bytes.size() >= Datagram::kHeaderSize.
[[nodiscard]] std::string acknowledgement(std::string_view bytes, uint16_t event);

[[nodiscard]] std::string datagramAsJson(const Datagram& datagram, std::string_view sender,
                                         std::string_view acknowledged);

}  // namespace kyt::devserver
