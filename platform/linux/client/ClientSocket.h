// What the client library asks of the operating system: a Unix stream socket that never blocks, a way to wait
// for many of them, a wake-up from other threads, and the thread itself. Used only by client/.
#pragma once

#include <poll.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace kyt::linux_client {

enum class Outcome : uint8_t { done, wouldBlock, ended };

// One connection. Move-only; closes at destruction. One thread at a time.
class ClientSocket {
 public:
  ClientSocket() = default;
  ClientSocket(ClientSocket&& other) noexcept;
  ClientSocket& operator=(ClientSocket&& other) noexcept;
  ~ClientSocket() { close(); }
  // wouldBlock: the listener's backlog is full, or there is no descriptor left: try again later; ended: nobody
  // listens, or the path is too long. Then `problem` has the path and the reason.
  [[nodiscard]] static Outcome connect(const std::string& path, ClientSocket& out, std::string& problem);
  // Writes a prefix of `bytes`, `descriptors` with the first byte; `written` is more than 0 when done.
  [[nodiscard]] Outcome write(std::string_view bytes, std::span<const int> descriptors, size_t& written);
  // Appends what has come to `buffer`, at most 64 KiB.
  [[nodiscard]] Outcome read(std::string& buffer);
  void close();
  [[nodiscard]] int fd() const { return fd_; }
  [[nodiscard]] bool isOpen() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};

// Wakes a waiting thread. wake() may be called from any thread and, like forkChild(), after fork().
class WakeUp {
 public:
  WakeUp();
  ~WakeUp();
  WakeUp(const WakeUp&) = delete;
  WakeUp& operator=(const WakeUp&) = delete;
  void wake();
  void clear();
  [[nodiscard]] int fd() const { return fd_; }

 private:
  int fd_;
};

// A set of descriptors to wait for, filled anew before each wait.
class WaitSet {
 public:
  void clear();
  size_t add(int fd, bool writable);  // always also for readable; returns the index
  // Waits for any of them, at most so long (negative: for ever).
  void wait(std::chrono::milliseconds timeout);
  [[nodiscard]] bool ready(size_t index) const;

 private:
  std::vector<pollfd> entries_;
};

[[nodiscard]] uint32_t effectiveUser();
// Starts a detached thread of that name (a literal) in which no signal of the program is handled.
bool startThread(const char* name, void (*run)(void*), void* argument);
// One line to standard error, in one write; a line that cannot be written is lost.
void writeLineToStandardError(std::string_view line);
// Registered once for the process.
void atFork(void (*prepare)(), void (*parent)(), void (*child)());

// The file for reading and its folder, opened with the caller's rights; false (with errno's text) when either
// cannot be.
struct OpenedFile {
  int file = -1, folder = -1;
  std::string error;
};
[[nodiscard]] OpenedFile openFileAndFolder(const std::string& path);
void closeDescriptor(int fd);
// An absolute path (the current folder in front of a relative one).
[[nodiscard]] std::string absolutePath(const std::string& path);

}  // namespace kyt::linux_client
