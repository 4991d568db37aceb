#include "platform/linux/client/ClientSocket.h"

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <utility>

namespace kyt::linux_client {

ClientSocket::ClientSocket(ClientSocket&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}

ClientSocket& ClientSocket::operator=(ClientSocket&& other) noexcept {
  if (this != &other) {
    close();
    fd_ = std::exchange(other.fd_, -1);
  }
  return *this;
}

void ClientSocket::close() {
  if (fd_ >= 0) ::close(std::exchange(fd_, -1));
}

Outcome ClientSocket::connect(const std::string& path, ClientSocket& out, std::string& problem) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    problem =
        path + ": a socket's path has at most " + std::to_string(sizeof address.sun_path - 1) + " bytes";
    return Outcome::ended;
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  ClientSocket made;
  made.fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (made.fd_ < 0) {
    problem = path + ": " + std::strerror(errno);
    return Outcome::wouldBlock;
  }
  while (::connect(made.fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    if (errno == EINTR) continue;
    const int error = errno;
    problem = path + ": " + (error == EAGAIN ? "too many connections wait" : std::strerror(error));
    return error == EAGAIN ? Outcome::wouldBlock : Outcome::ended;
  }
  out = std::move(made);
  return Outcome::done;
}

Outcome ClientSocket::write(std::string_view bytes, std::span<const int> descriptors, size_t& written) {
  iovec vector{const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &vector;
  message.msg_iovlen = 1;
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * 16)> control{};
  if (!descriptors.empty()) {
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(descriptors.size_bytes());
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(descriptors.size_bytes());
    std::memcpy(CMSG_DATA(header), descriptors.data(), descriptors.size_bytes());
  }
  for (;;) {
    const ssize_t result = sendmsg(fd_, &message, MSG_NOSIGNAL);
    if (result >= 0) {
      written = static_cast<size_t>(result);
      return Outcome::done;
    }
    if (errno == EINTR) continue;
    return errno == EAGAIN ? Outcome::wouldBlock : Outcome::ended;
  }
}

Outcome ClientSocket::read(std::string& buffer) {
  std::array<char, 65536> bytes;
  for (;;) {
    // Without room for control data: descriptors that nobody asked for are closed by the kernel.
    const ssize_t result = recv(fd_, bytes.data(), bytes.size(), 0);
    if (result > 0) {
      buffer.append(bytes.data(), static_cast<size_t>(result));
      return Outcome::done;
    }
    if (result < 0 && errno == EINTR) continue;
    return result < 0 && errno == EAGAIN ? Outcome::wouldBlock : Outcome::ended;
  }
}

WakeUp::WakeUp() : fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

WakeUp::~WakeUp() {
  if (fd_ >= 0) close(fd_);
}

void WakeUp::wake() {
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t written = write(fd_, &one, sizeof one);
}

void WakeUp::clear() {
  uint64_t count = 0;
  [[maybe_unused]] const ssize_t got = read(fd_, &count, sizeof count);
}

void WaitSet::clear() {
  entries_.clear();
}

size_t WaitSet::add(int fd, bool writable) {
  entries_.push_back({fd, static_cast<short>(POLLIN | (writable ? POLLOUT : 0)), 0});
  return entries_.size() - 1;
}

void WaitSet::wait(std::chrono::milliseconds timeout) {
  const auto milliseconds =
      timeout.count() < 0 ? -1 : static_cast<int>(std::min<long>(timeout.count(), INT_MAX));
  if (poll(entries_.data(), entries_.size(), milliseconds) > 0) return;
  for (pollfd& entry : entries_) entry.revents = 0;
}

bool WaitSet::ready(size_t index) const {
  return entries_[index].revents != 0;
}

uint32_t effectiveUser() {
  return geteuid();
}

bool startThread(const char* name, void (*run)(void*), void* argument) {
  struct Start {
    const char* name;
    void (*run)(void*);
    void* argument;
  };
  auto* start = new Start{name, run, argument};
  sigset_t all, before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  pthread_t thread{};
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
  pthread_attr_setstacksize(&attributes, 512 * 1024);
  const int result = pthread_create(
      &thread, &attributes,
      [](void* given) -> void* {
        const Start copy = *static_cast<Start*>(given);
        delete static_cast<Start*>(given);
        // Its own work: it may have ended, and nobody joins it, before whoever starts it could name it.
        pthread_setname_np(pthread_self(), copy.name);
        copy.run(copy.argument);
        return nullptr;
      },
      start);
  pthread_attr_destroy(&attributes);
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (result != 0) delete start;
  return result == 0;
}

void writeLineToStandardError(std::string_view line) {
  std::string text(line);
  text += '\n';
  [[maybe_unused]] const ssize_t written = write(STDERR_FILENO, text.data(), text.size());
}

void atFork(void (*prepare)(), void (*parent)(), void (*child)()) {
  pthread_atfork(prepare, parent, child);
}

OpenedFile openFileAndFolder(const std::string& path) {
  OpenedFile opened;
  // Not blocking: a FIFO without a writer must not hold the caller; the daemon refuses what is no regular
  // file.
  opened.file = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  const size_t slash = path.rfind('/');
  const std::string folder = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
  if (opened.file >= 0) opened.folder = open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (opened.file < 0 || opened.folder < 0) {
    opened.error = path + ": " + std::strerror(errno);
    closeDescriptor(std::exchange(opened.file, -1));
  }
  return opened;
}

void closeDescriptor(int fd) {
  if (fd >= 0) close(fd);
}

std::string absolutePath(const std::string& path) {
  if (!path.empty() && path.front() == '/') return path;
  char* folder = getcwd(nullptr, 0);
  if (folder == nullptr) return path;
  std::string absolute = std::string(folder) + "/" + path;
  std::free(folder);
  return absolute;
}

}  // namespace kyt::linux_client
