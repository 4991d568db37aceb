// What leaves the device, for its owner. Back ends tell it of each request that a server answered or may have got, never of
// each event.
//
// Callers: replies to posts and uploads, on any thread. Must not wait for long: a file may be looked at, not written.
#pragma once

#include <algorithm>
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

// An address without a name and password before the host, which are for the server alone.
[[nodiscard]] inline std::string withoutPassword(std::string_view url) {
  const size_t scheme = url.find("://");
  if (scheme == std::string_view::npos) return std::string(url);
  const size_t begin = scheme + 3;
  const std::string_view host = url.substr(begin, url.find_first_of("/?#", begin) - begin);
  const size_t at = host.rfind('@');
  const size_t rest = at != std::string_view::npos ? begin + at + 1 : begin;
  return std::string(url.substr(0, begin)).append(url.substr(rest));
}

// "https://host:port" of an address, likewise; the whole of what has no such form.
[[nodiscard]] inline std::string serverOf(std::string_view url) {
  std::string server = withoutPassword(url);
  const size_t scheme = server.find("://");
  if (scheme != std::string::npos)
    server.resize(std::min(server.find_first_of("/?#", scheme + 3), server.size()));
  return server;
}

}  // namespace kyt
