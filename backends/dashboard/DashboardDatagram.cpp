#include "backends/dashboard/DashboardDatagram.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

namespace kyt {

// The header's fields: where each stands and how many bytes it has.
struct DashboardDatagram::Field {
  size_t at, width;
};

namespace {

constexpr int32_t kTimeUnit = 4000;  // microseconds

uint32_t bigEndian(std::span<const std::byte> bytes) {
  uint32_t number = 0;
  for (const std::byte byte : bytes) number = number << 8 | std::to_integer<uint32_t>(byte);
  return number;
}

}  // namespace

struct DashboardDatagram::Fields {
  static constexpr Field selfVersionMajor{0, 1}, clientType{1, 1}, one{2, 1}, fraction{3, 1}, seconds{4, 4},
      sessionID{8, 4}, clientVersion{12, 2}, length{14, 2}, method{16, 2}, respCode{18, 2}, device{20, 40},
      eventID{60, 2}, flags{62, 2};
};

void DashboardDatagram::put(const Field& field, uint64_t number) {
  for (size_t i = 0; i < field.width; ++i)
    bytes_[field.at + i] = static_cast<std::byte>(number >> (8 * (field.width - 1 - i)));
}

uint32_t DashboardDatagram::number(const Field& field) const {
  return bigEndian(std::span(bytes_).subspan(field.at, field.width));
}

// The session, the client's version and the length are complemented: receivers complement them back.
void DashboardDatagram::fill(const Header& header) {
  put(Fields::selfVersionMajor, header.selfVersionMajor);
  put(Fields::clientType, header.clientType);
  put(Fields::one, 1);
  put(Fields::fraction, static_cast<uint64_t>(header.time.microseconds / kTimeUnit));
  put(Fields::seconds, static_cast<uint64_t>(header.time.seconds));
  put(Fields::sessionID, static_cast<uint32_t>(~header.sessionID));
  put(Fields::clientVersion, static_cast<uint16_t>(~header.clientVersion));
  put(Fields::method, header.method);
  put(Fields::respCode, header.respCode);
  // No terminator; a shorter identifier leaves zeros behind it.
  const std::string_view device = header.udid.substr(0, Fields::device.width);
  std::copy_n(reinterpret_cast<const std::byte*>(device.data()), device.size(), &bytes_[Fields::device.at]);
  put(Fields::eventID, header.eventID);
  put(Fields::flags, header.flags);
}

DashboardDatagram::Header DashboardDatagram::header() const {
  Header header;
  header.selfVersionMajor = static_cast<uint8_t>(number(Fields::selfVersionMajor));
  header.clientType = static_cast<uint8_t>(number(Fields::clientType));
  header.time.seconds = number(Fields::seconds);
  header.time.microseconds = static_cast<int32_t>(number(Fields::fraction)) * kTimeUnit;
  header.sessionID = ~number(Fields::sessionID);
  header.clientVersion = static_cast<uint16_t>(~number(Fields::clientVersion));
  header.method = static_cast<uint16_t>(number(Fields::method));
  header.respCode = static_cast<uint16_t>(number(Fields::respCode));
  header.eventID = static_cast<uint16_t>(number(Fields::eventID));
  header.flags = static_cast<uint16_t>(number(Fields::flags));
  const std::string_view device(reinterpret_cast<const char*>(&bytes_[Fields::device.at]),
                                Fields::device.width);
  header.udid = device.substr(0, device.find('\0'));
  return header;
}

std::optional<uint16_t> DashboardDatagram::acknowledgedEvent(std::span<const std::byte> received) {
  constexpr Field kEvent = Fields::eventID;
  if (received.size() < kEvent.at + kEvent.width) return std::nullopt;
  return static_cast<uint16_t>(bigEndian(received.subspan(kEvent.at, kEvent.width)));
}

void DashboardDatagram::appendPair(const char* key, const char* value) {
  char soFar[kTextSize];
  std::memcpy(soFar, writableText(), textLength_ + 1);
  const int whole = std::snprintf(writableText(), kTextSize, "%s %s=%s", soFar, key, value);
  textLength_ = std::min(static_cast<size_t>(std::max(whole, 0)), kTextSize - 1);
}

void DashboardDatagram::finish() {
  put(Fields::length, static_cast<uint16_t>(~length()));
}

}  // namespace kyt
