// What the handler of a signal does to send bytes that were made before: no memory, no lock, nothing but system calls that
// such a handler may make.
#pragma once

#include <sys/un.h>

#include <cstdint>
#include <optional>
#include <string>
#include <utility>

namespace kyt::linux_client {

class LastSocket {
 public:
  // None where the path of the socket is too long.
  [[nodiscard]] static std::optional<LastSocket> make(const std::string& path, std::string bytes);

  // Connects, writes all and waits for the answer, in so many milliseconds at most. The answer follows two lines of the
  // handshake; whether it says that the event is taken. Async-signal-safe, and leaves errno as it was.
  [[nodiscard]] bool send(unsigned timeoutMilliseconds) const noexcept;

 private:
  LastSocket(const sockaddr_un& address, std::string bytes) : address_(address), bytes_(std::move(bytes)) {}
  [[nodiscard]] bool exchange(int fd, int64_t deadline) const noexcept;
  [[nodiscard]] bool write(int fd, int64_t deadline) const noexcept;
  [[nodiscard]] static bool isTaken(int fd, int64_t deadline) noexcept;

  sockaddr_un address_;
  std::string bytes_;
};

}  // namespace kyt::linux_client
