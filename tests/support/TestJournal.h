// A journal of a test's own at the fixed address of the real one. Only in a child process that may mount (see
// ChildProcess.h), where hideRun() comes first.
#pragma once

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <csignal>
#include <cstring>
#include <functional>
#include <memory>
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
  // … of one that comes in a file of memory. Empty where it comes otherwise, or the file could still be changed.
  [[nodiscard]] std::string nextEntryInFile() const {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message = {};
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    if (::recvmsg(socket_, &message, MSG_CMSG_CLOEXEC) != 0 || message.msg_controllen < CMSG_LEN(sizeof(int)))
      return {};
    int file = -1;
    std::memcpy(&file, CMSG_DATA(CMSG_FIRSTHDR(&message)), sizeof file);
    constexpr int kSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL;
    struct stat status = {};
    std::string entry;
    if (::fcntl(file, F_GET_SEALS) == kSeals && ::fstat(file, &status) == 0) {
      entry.resize(static_cast<size_t>(status.st_size));
      if (::pread(file, entry.data(), entry.size(), 0) != status.st_size) entry.clear();
    }
    ::close(file);
    return entry;
  }

 private:
  const int socket_;
  bool isOpen_ = false;
};

// What `work` says in a process that finds a journal of its own; whoever waits for that is ended after a while.
inline std::string withAJournal(const std::function<std::string(std::unique_ptr<TestJournal>&)>& work) {
  return inChildProcess([&]() -> std::string {
    std::signal(SIGALRM, SIG_DFL);
    ::alarm(60);
    if (!TestJournal::hideRun()) return "no mount namespace";
    auto journal = std::make_unique<TestJournal>();
    return journal->isOpen() ? work(journal) : "bind";
  });
}

inline std::string messageOf(const std::string& entry) {
  return entry.substr(0, entry.find('\n'));
}

}  // namespace kyt
