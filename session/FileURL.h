// Reads the file URLs that clients send with uploads.
#pragma once

#include <optional>

#include "platform/objects/Value.h"

namespace kyt {

// The path of "file:///folder/name" (or with the host "localhost"), its percent-escapes decoded; none for
// anything else, for a malformed escape and for a path with a NUL.
[[nodiscard]] std::optional<String> pathOfFileURL(const String& url);

}  // namespace kyt
