// A client of the daemon in its cheapest form: a socket and bytes prepared beforehand, so that a benchmark's
// load costs little beside what it measures.
#pragma once

#include <sched.h>

#include <cstdint>
#include <initializer_list>
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

// What the kernel says of a process.
struct ProcessFigures {
  double processorSeconds = 0;
  uint64_t anonymousBytes = 0, residentBytes = 0;
  uint64_t switches = 0;  // voluntary context switches of all its threads
};
[[nodiscard]] ProcessFigures figuresOf(int pid);
[[nodiscard]] double processorSeconds(int pid);

// Keeps the calling thread and all threads of these processes on the processor on which the caller is now;
// lets the calling thread go at the end, the processes not.
class OneProcessor {
 public:
  explicit OneProcessor(std::initializer_list<int> pids);
  ~OneProcessor();
  OneProcessor(const OneProcessor&) = delete;
  OneProcessor& operator=(const OneProcessor&) = delete;

 private:
  cpu_set_t former_;
};

}  // namespace kyt::bench
