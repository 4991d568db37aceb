#include "platform/linux/base/UnixSocket.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "platform/base/Blocking.h"
#include "platform/base/Limits.h"
#include "platform/linux/base/Descriptors.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace kyt {
namespace {

constexpr int kFirstActivatedDescriptor = 3;
constexpr size_t kMostPassed = 253;  // descriptors that the kernel lets one message carry

Error systemError(const std::string& what) {
  const int code = errno;
  return Error{"POSIX", code, what + ": " + std::strerror(code)};
}

// An option whose size is known only afterwards.
std::vector<char> variableOption(int socket, int option) {
  std::vector<char> value(256);
  for (int attempt = 0; attempt < 4; ++attempt) {
    auto size = static_cast<socklen_t>(value.size());
    if (::getsockopt(socket, SOL_SOCKET, option, value.data(), &size) == 0) {
      value.resize(size);
      return value;
    }
    if (errno != ERANGE) break;
    value.resize(size > value.size() ? size : value.size() * 2);
  }
  return {};
}

bool fillAddress(const std::string& path, sockaddr_un& address) {
  address = {};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, path.data(), path.size());
  return true;
}

// What another process made may wait at its last close for as long as that process likes: a TCP socket that lingers, a
// file whose file system never answers. So may a connection's own socket, in which such descriptors still lie.
Descriptor ownDescriptorOfPeer(int descriptor) {
  return {descriptor, [](int closed) {
            const BlockingScope blocking;
            closeDescriptor(closed);
          }};
}

// Whether somebody listens there. Anything but "refused" and "no such file" counts as somebody.
bool isLive(const sockaddr_un& address) {
  const Descriptor probe = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (probe.get() < 0) return true;
  if (::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) return true;
  return errno != ECONNREFUSED && errno != ENOENT;
}

}  // namespace

bool kernelTellsPeerProcess() {
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return false;
  const Descriptor one = ownDescriptor(ends[0]), other = ownDescriptor(ends[1]);
  int pidfd = -1;
  socklen_t size = sizeof pidfd;
  if (::getsockopt(one.get(), SOL_SOCKET, SO_PEERPIDFD, &pidfd, &size) != 0) return errno != ENOPROTOOPT;
  const Descriptor process = ownDescriptor(pidfd);
  return true;
}

// Takes too many descriptors as well: the kernel closes, within the call, what finds no room.
StreamResult UnixStream::read(std::span<std::byte> buffer, std::vector<Descriptor>& descriptors) {
  iovec piece{buffer.data(), buffer.size()};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * kMostPassed)> control;
  msghdr message{};
  message.msg_iov = &piece;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  ssize_t count = 0;
  do {
    count = ::recvmsg(socket_.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  } while (count < 0 && errno == EINTR);
  if (count < 0) return {errno == EAGAIN ? StreamStatus::wouldBlock : StreamStatus::failed, 0};
  for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr; header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
    const size_t bytes = header->cmsg_len - CMSG_LEN(0);
    for (size_t at = 0; at + sizeof(int) <= bytes; at += sizeof(int)) {
      int received = -1;
      std::memcpy(&received, CMSG_DATA(header) + at, sizeof received);
      descriptors.push_back(ownDescriptorOfPeer(received));
      room_->noteUsed(received);
    }
  }
  const bool tooMany = descriptors.size() > Limits::maxDescriptorsPerMessage;
  if (tooMany || (message.msg_flags & MSG_CTRUNC) != 0) return {StreamStatus::truncated, 0};
  if (count == 0) return {StreamStatus::ended, 0};
  return {StreamStatus::ok, static_cast<size_t>(count)};
}

StreamResult UnixStream::write(std::string_view bytes) {
  ssize_t count = 0;
  do {
    count = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
  } while (count < 0 && errno == EINTR);
  if (count < 0) return {errno == EAGAIN ? StreamStatus::wouldBlock : StreamStatus::failed, 0};
  return {StreamStatus::ok, static_cast<size_t>(count)};
}

PeerCredentials UnixStream::peer() {
  PeerCredentials peer;
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket_.get(), SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) {
    peer.uid = peer.gid = ~0u;  // nobody: no grant matches
    return peer;
  }
  peer.pid = credentials.pid;
  peer.uid = credentials.uid;
  peer.gid = credentials.gid;
  const std::vector<char> groups = variableOption(socket_.get(), SO_PEERGROUPS);
  peer.groups.resize(groups.size() / sizeof(gid_t));
  if (!groups.empty()) std::memcpy(peer.groups.data(), groups.data(), peer.groups.size() * sizeof(gid_t));
  const std::vector<char> label = variableOption(socket_.get(), SO_PEERSEC);
  if (!label.empty()) peer.securityLabel.assign(label.data(), ::strnlen(label.data(), label.size()));
  int pidfd = -1;
  size = sizeof pidfd;
  if (::getsockopt(socket_.get(), SOL_SOCKET, SO_PEERPIDFD, &pidfd, &size) == 0)
    peer.pidfd = ownDescriptor(pidfd);
  return peer;
}

std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> UnixSocketAcceptor::bindAt(const std::string& path) {
  return bindWithMode(path, 0666, std::nullopt);
}

std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> UnixSocketAcceptor::bindForGroup(
    const std::string& path, std::optional<uint32_t> group) {
  // A file's group is its maker's, so no right to give files away is needed. A member that may not take the group for its
  // own gives it to the file afterwards.
  const gid_t own = ::getegid();
  const bool taken = group && *group != own && ::setegid(*group) == 0;
  auto made = bindWithMode(path, group ? 0660 : 0600, group);
  if (taken && ::setegid(own) != 0) return systemError("Cannot take the own group again");
  return made;
}

// Nobody can connect before listen().
std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> UnixSocketAcceptor::bindWithMode(
    const std::string& path, unsigned mode, std::optional<uint32_t> group) {
  sockaddr_un address;
  if (!fillAddress(path, address)) {
    return Error{"POSIX", ENAMETOOLONG, "The socket path \"" + path + "\" is empty or longer than 107 bytes"};
  }
  Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (socket.get() < 0) return systemError("Cannot make a socket");
  struct stat status {};
  if (::lstat(path.c_str(), &status) == 0) {
    if (!S_ISSOCK(status.st_mode)) return Error{"POSIX", EEXIST, "\"" + path + "\" exists and is no socket"};
    if (isLive(address)) return Error{"POSIX", EADDRINUSE, "Another process listens at \"" + path + "\""};
    if (::unlink(path.c_str()) != 0) return systemError("Cannot remove the stale socket \"" + path + "\"");
  }
  if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    return systemError("Cannot bind to \"" + path + "\"");
  }
  if (::lstat(path.c_str(), &status) != 0) return systemError("Cannot find \"" + path + "\" again");
  const auto refused = [&] {
    Error error = systemError("Cannot open \"" + path + "\" to clients");
    ::unlink(path.c_str());
    return error;
  };
  if (group && status.st_gid != *group && ::chown(path.c_str(), static_cast<uid_t>(-1), *group) != 0)
    return refused();
  if (::chmod(path.c_str(), mode) != 0) return refused();
  if (::listen(socket.get(), SOMAXCONN) != 0) return systemError("Cannot listen at \"" + path + "\"");
  return std::unique_ptr<UnixSocketAcceptor>(
      new UnixSocketAcceptor(std::move(socket), path, status.st_dev, status.st_ino));
}

std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> UnixSocketAcceptor::adoptActivated() {
  const char* const pid = std::getenv("LISTEN_PID");
  const char* const count = std::getenv("LISTEN_FDS");
  if (pid == nullptr || count == nullptr || std::to_string(::getpid()) != pid) {
    return std::unique_ptr<UnixSocketAcceptor>();
  }
  const std::string given = count;
  ::unsetenv("LISTEN_PID");
  ::unsetenv("LISTEN_FDS");
  ::unsetenv("LISTEN_FDNAMES");
  if (given != "1")
    return Error{"POSIX", EINVAL, "The service manager passed " + given + " sockets instead of one"};
  return adopt(ownDescriptor(kFirstActivatedDescriptor));
}

std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> UnixSocketAcceptor::adopt(Descriptor socket) {
  int domain = 0, type = 0, listening = 0;
  socklen_t size = sizeof domain;
  const auto option = [&](int name, int& value) {
    size = sizeof value;
    return ::getsockopt(socket.get(), SOL_SOCKET, name, &value, &size) == 0;
  };
  if (!option(SO_DOMAIN, domain) || !option(SO_TYPE, type) || !option(SO_ACCEPTCONN, listening) ||
      domain != AF_UNIX || type != SOCK_STREAM || listening != 1) {
    return Error{"POSIX", EINVAL, "The descriptor that was passed is no listening Unix stream socket"};
  }
  const int flags = ::fcntl(socket.get(), F_GETFL);
  if (flags < 0 || ::fcntl(socket.get(), F_SETFL, flags | O_NONBLOCK) != 0 ||
      ::fcntl(socket.get(), F_SETFD, FD_CLOEXEC) != 0) {
    return systemError("Cannot set up the socket that was passed");
  }
  return std::unique_ptr<UnixSocketAcceptor>(new UnixSocketAcceptor(std::move(socket), std::string(), 0, 0));
}

UnixSocketAcceptor::~UnixSocketAcceptor() {
  if (path_.empty()) return;
  struct stat status {};
  if (::lstat(path_.c_str(), &status) == 0 && status.st_dev == device_ && status.st_ino == inode_) {
    ::unlink(path_.c_str());
  }
}

AcceptStatus UnixSocketAcceptor::accept(std::unique_ptr<Stream>& stream) {
  Descriptor socket =
      ownDescriptorOfPeer(::accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
  if (socket.get() >= 0) {
    room_->noteUsed(socket.get());
    stream = std::make_unique<UnixStream>(std::move(socket), room_);
    return AcceptStatus::accepted;
  }
  switch (errno) {
    case EAGAIN:
      return AcceptStatus::wouldBlock;
    case EINTR:
    case ECONNABORTED:
    case EPROTO:
    case EPERM:
      return AcceptStatus::retry;
    case EMFILE:
    case ENFILE:
    case ENOBUFS:
    case ENOMEM:
      return AcceptStatus::exhausted;
    default:
      return AcceptStatus::failed;
  }
}

}  // namespace kyt
