// The fixed names and numbers of the wire protocol: message types, flags, header fields, our interfaces, the
// standard ones, and the standard errors. Used by both sides; docs/WIRE-IPC.md shows them in a worked
// example.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

namespace kyt::wire {

enum class MessageType : uint8_t { methodCall = 1, methodReturn = 2, error = 3, signal = 4 };

inline constexpr uint8_t kNoReplyExpected = 0x01;
inline constexpr uint8_t kNoAutoStart = 0x02;
inline constexpr uint8_t kAllowInteractiveAuthorization = 0x04;
inline constexpr uint8_t kProtocolVersion = 1;

enum class Field : uint8_t {
  path = 1,
  interface = 2,
  member = 3,
  errorName = 4,
  replySerial = 5,
  destination = 6,
  sender = 7,
  signature = 8,
  unixFds = 9
};

// The fixed part of a header, up to and including the length of the field array.
inline constexpr size_t kFixedHeaderBytes = 16;
inline constexpr uint32_t kMaxArrayBytes = 1u << 26;
inline constexpr uint32_t kMaxMessageBytes = 1u << 27;
inline constexpr size_t kMaxSignatureBytes = 255;
inline constexpr size_t kMaxNameBytes = 255;

inline constexpr std::string_view kServiceName = "com.vantu.kytreportingd";
inline constexpr std::string_view kSessionPath = "/com/vantu/kytreportingd";
inline constexpr std::string_view kSessionInterface = "com.vantu.kytreportingd.ClientSessionInterface";
inline constexpr std::string_view kClientPath = "/com/vantu/kytreportingd/client";
inline constexpr std::string_view kReplyInterface = "com.vantu.kytreportingd.ClientSessionReplyInterface";

// At the same path, on the administration socket.
inline constexpr std::string_view kAdministrationInterface = "com.vantu.kytreportingd.Administration";

inline constexpr std::string_view kBusName = "org.freedesktop.DBus";
inline constexpr std::string_view kBusPath = "/org/freedesktop/DBus";
inline constexpr std::string_view kPeerInterface = "org.freedesktop.DBus.Peer";
inline constexpr std::string_view kIntrospectableInterface = "org.freedesktop.DBus.Introspectable";
inline constexpr std::string_view kPropertiesInterface = "org.freedesktop.DBus.Properties";

inline constexpr std::string_view kErrorFailed = "org.freedesktop.DBus.Error.Failed";
inline constexpr std::string_view kErrorAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";
inline constexpr std::string_view kErrorLimitsExceeded = "org.freedesktop.DBus.Error.LimitsExceeded";
inline constexpr std::string_view kErrorInvalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";
inline constexpr std::string_view kErrorUnknownMethod = "org.freedesktop.DBus.Error.UnknownMethod";
inline constexpr std::string_view kErrorUnknownInterface = "org.freedesktop.DBus.Error.UnknownInterface";
inline constexpr std::string_view kErrorUnknownObject = "org.freedesktop.DBus.Error.UnknownObject";
inline constexpr std::string_view kErrorUnknownProperty = "org.freedesktop.DBus.Error.UnknownProperty";

}  // namespace kyt::wire
