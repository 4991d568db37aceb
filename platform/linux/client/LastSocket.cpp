#include "platform/linux/client/LastSocket.h"

#include <poll.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace kyt::linux_client {

namespace {

constexpr int kMillisecondsBetweenAttempts = 5;  // while too many connections wait
constexpr char kMethodReturn = 2;                // the second byte of such a message
// What the daemon returns where it has taken a single message, as the body ends; any other text says why it has not.
constexpr char kTaken[] = "finished";

constexpr size_t kMostOfAnswer = 512;  // one that has taken the event is shorter
constexpr size_t kFixedHeaderBytes = 16;

// Of a message whose fixed header this is, written by a program of this machine: in its byte order.
uint64_t messageSize(const char* header) noexcept {
  uint32_t body = 0, fields = 0;
  std::memcpy(&body, header + 4, sizeof body);
  std::memcpy(&fields, header + 12, sizeof fields);
  return ((kFixedHeaderBytes + uint64_t{fields} + 7) & ~uint64_t{7}) + body;
}

int64_t nowMilliseconds() noexcept {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

bool waitFor(int fd, short events, int64_t deadline) noexcept {
  pollfd entry{fd, events, 0};
  for (;;) {
    const int64_t left = deadline - nowMilliseconds();
    if (left <= 0) return false;
    const int ready = poll(&entry, 1, static_cast<int>(std::min<int64_t>(left, 1000)));
    if (ready > 0) return true;
    if (ready < 0 && errno != EINTR) return false;
  }
}

}  // namespace

std::optional<LastSocket> LastSocket::make(const std::string& path, std::string bytes) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return std::nullopt;
  std::memcpy(address.sun_path, path.data(), path.size());
  return LastSocket(address, std::move(bytes));
}

bool LastSocket::send(unsigned timeoutMilliseconds) const noexcept {
  const int before = errno;
  const int64_t deadline = nowMilliseconds() + timeoutMilliseconds;
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  const bool isTaken = fd >= 0 && exchange(fd, deadline);
  if (fd >= 0) close(fd);
  errno = before;
  return isTaken;
}

bool LastSocket::exchange(int fd, int64_t deadline) const noexcept {
  while (connect(fd, reinterpret_cast<const sockaddr*>(&address_), sizeof address_) != 0) {
    if (errno != EINTR && errno != EAGAIN) return false;
    if (nowMilliseconds() >= deadline) return false;
    if (errno == EAGAIN) poll(nullptr, 0, kMillisecondsBetweenAttempts);
  }
  return write(fd, deadline) && isTaken(fd, deadline);
}

bool LastSocket::write(int fd, int64_t deadline) const noexcept {
  for (size_t at = 0; at < bytes_.size();) {
    const ssize_t written = ::send(fd, bytes_.data() + at, bytes_.size() - at, MSG_NOSIGNAL);
    if (written > 0) at += static_cast<size_t>(written);
    if (written < 0 && errno == EAGAIN && !waitFor(fd, POLLOUT, deadline)) return false;
    if (written < 0 && errno != EAGAIN && errno != EINTR) return false;
  }
  return true;
}

bool LastSocket::isTaken(int fd, int64_t deadline) noexcept {
  int lines = 0;  // of the handshake
  char message[kMostOfAnswer];
  size_t size = 0;
  while (waitFor(fd, POLLIN, deadline)) {
    char bytes[256];
    const ssize_t got = recv(fd, bytes, sizeof bytes, 0);
    if (got == 0 || (got < 0 && errno != EAGAIN && errno != EINTR)) return false;
    for (ssize_t i = 0; i < got; ++i) {
      if (lines < 2) {
        if (bytes[i] == '\n') ++lines;
      } else if (size < sizeof message) {
        message[size++] = bytes[i];
      }
    }
    if (size < kFixedHeaderBytes) continue;
    const uint64_t whole = messageSize(message);
    if (message[1] != kMethodReturn || whole > sizeof message) return false;
    if (size >= whole)
      return whole >= sizeof kTaken &&
             std::memcmp(message + whole - sizeof kTaken, kTaken, sizeof kTaken) == 0;
  }
  return false;
}

}  // namespace kyt::linux_client
