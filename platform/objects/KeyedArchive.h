// Whole objects as bytes and back: what a client's log data travels in. The format is CBOR (RFC 8949), told
// in docs/WIRE-LOGDATA.md. Pure functions; any thread.
//
// Reading is for programs that receive archives, so its input is hostile: depth and lengths are checked
// before anything is allocated for them.
#pragma once

#include <optional>
#include <string_view>
#include <variant>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"

namespace kyt {

inline constexpr char kKeyedArchiveErrorDomain[] = "KYTKeyedArchiveErrorDomain";

// None for objects nested deeper than Limits::maxObjectDepth and for text that is no UTF-8.
[[nodiscard]] std::optional<Data> archivedData(const Value& value);
// The object, or an error whose code is the offset of what is wrong and whose description says what it is.
[[nodiscard]] std::variant<Value, Error> unarchivedObject(std::string_view bytes);

}  // namespace kyt
