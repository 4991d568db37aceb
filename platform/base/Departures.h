// What leaves the device, for its owner. Back ends tell it of each request that a server answered or may have got, never of
// each event.
//
// Callers: replies to posts and uploads, on any thread. Must not wait for long: a file may be looked at, not written.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/base/Books.h"

namespace kyt {

enum class DepartureKind : uint8_t { events, file, logData };

struct Departure {
  ReportingProgram program;
  std::string server;  // scheme, host and port of the address: serverOf()
  DepartureKind kind = DepartureKind::events;
  uint64_t events = 0;
  uint64_t bytes = 0;      // of the body as it left
  bool isAnswered = true;  // false: the connection failed, or was cut off, so it may have arrived or not
};

class Departures {
 public:
  virtual ~Departures() = default;
  virtual void add(const Departure& departure) = 0;
};

// Of programs that are their owner's own, and of what only would leave.
class NoDepartures final : public Departures {
 public:
  void add(const Departure&) override {}
};

// "https://host:port" of an address, without a name and password before the host, which are for the server alone; the whole of
// what has no such form.
[[nodiscard]] inline std::string serverOf(std::string_view url) {
  const size_t scheme = url.find("://");
  if (scheme == std::string_view::npos) return std::string(url);
  const size_t begin = scheme + 3;
  std::string_view host = url.substr(begin, url.find_first_of("/?#", begin) - begin);
  if (const size_t at = host.rfind('@'); at != std::string_view::npos) host.remove_prefix(at + 1);
  return std::string(url.substr(0, begin)).append(host);
}

}  // namespace kyt
