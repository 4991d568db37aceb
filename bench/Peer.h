// A client of the daemon in its cheapest form: a socket and bytes prepared beforehand, so that a benchmark's
// load costs little beside what it measures.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace kyt::bench {

class Peer {
 public:
  Peer() = default;
  Peer(Peer&& other) noexcept;
  Peer& operator=(Peer&& other) noexcept;
  ~Peer();
  // Connected, identified and configured; none when the daemon refuses or answers no live back end.
  [[nodiscard]] static std::optional<Peer> open(const std::string& socketPath, uint32_t sessionID);
  // All of it; blocks while the daemon does not read.
  [[nodiscard]] bool send(std::string_view bytes);
  // A call of Peer.Ping and its reply: everything sent before has been handled. Blocks.
  [[nodiscard]] bool ping();
  // Both in one write, as a client's queue leaves.
  [[nodiscard]] bool sendAndPing(std::string bytes);
  // A call of FlushMessagesWithCompletion and its reply. Blocks.
  [[nodiscard]] bool flush();

 private:
  [[nodiscard]] bool call(std::string_view interface, std::string_view member, std::string before = {});
  [[nodiscard]] bool awaitReply(uint32_t serial);
  int fd_ = -1;
  std::string in_;
};

}  // namespace kyt::bench
