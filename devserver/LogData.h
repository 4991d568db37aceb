// Reads the archive in which a client's log data comes. A pure function; any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace kyt::devserver {

struct LogData {
  std::string name;           // 16 digits of its SHA-256
  std::string reason;         // why it is bad; empty: it is good
  uint64_t entries = 0;       // of the array
  std::string json = "null";  // what it holds, dates as texts, data as {"base64": …}
};

[[nodiscard]] LogData readLogData(std::string_view body);

}  // namespace kyt::devserver
