// A journal of a test's own at the fixed address of the real one. Only in a child process that may mount (see
// ChildProcess.h), where hideRun() comes first.
#pragma once

#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "tests/support/ChildProcess.h"

namespace kyt {

class TestJournal {
 public:
  // From here on this process, and no other, finds /run empty. Whether it could be done.
  [[nodiscard]] static bool hideRun() {
    return unshareMounts() && ::mount("tmpfs", "/run", "tmpfs", 0, nullptr) == 0;
  }

  TestJournal() : socket_(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    ::mkdir("/run/systemd", 0755);
    ::mkdir("/run/systemd/journal", 0755);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, "/run/systemd/journal/socket");
    isOpen_ = ::bind(socket_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  }
  ~TestJournal() { ::close(socket_); }
  TestJournal(const TestJournal&) = delete;
  TestJournal& operator=(const TestJournal&) = delete;

  [[nodiscard]] bool isOpen() const { return isOpen_; }
  // Waits for it.
  [[nodiscard]] std::string nextEntry() const {
    char buffer[4096];
    const ssize_t count = ::recv(socket_, buffer, sizeof buffer, 0);
    return {buffer, static_cast<size_t>(count > 0 ? count : 0)};
  }

 private:
  const int socket_;
  bool isOpen_ = false;
};

}  // namespace kyt
