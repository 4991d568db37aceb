// Unix stream sockets for the IPC server: a connection's stream, and the listening socket, which is either
// made at a path (taking the place of a stale socket, never of a live one) or handed over by the service
// manager.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "platform/Stream.h"
#include "platform/base/Error.h"
#include "platform/linux/base/DescriptorRoom.h"

namespace kyt {

// Whether the kernel can say which process is at the other end (SO_PEERPIDFD, from Linux 6.5 on).
[[nodiscard]] bool kernelTellsPeerProcess();

class UnixStream final : public Stream {
 public:
  UnixStream(Descriptor socket, std::shared_ptr<DescriptorRoom> room)
      : socket_(std::move(socket)), room_(std::move(room)) {}
  [[nodiscard]] StreamResult read(std::span<std::byte> buffer, std::vector<Descriptor>& descriptors) override;
  [[nodiscard]] StreamResult write(std::string_view bytes) override;
  [[nodiscard]] PeerCredentials peer() override;
  [[nodiscard]] int descriptor() const override { return socket_.get(); }

 private:
  const Descriptor socket_;
  const std::shared_ptr<DescriptorRoom> room_;  // of all streams of one acceptor
};

// Made before there are threads: it makes room for the descriptors of its connections.
class UnixSocketAcceptor final : public StreamAcceptor {
 public:
  // Binds and listens at `path` with mode 0666 (who may connect is the entitlements' matter). The error's
  // description is one line for the log.
  [[nodiscard]] static std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> bindAt(
      const std::string& path);
  // The same for root, the process's own user and the members of a group alone: mode 0660, or 0600 without one. Only
  // before other threads exist, with the right to make files of that group: as root, with CAP_SETGID, or as its member.
  [[nodiscard]] static std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> bindForGroup(
      const std::string& path, std::optional<uint32_t> group);
  // Takes over the one listening socket that the service manager passed (LISTEN_PID, LISTEN_FDS; both are
  // removed from the environment); null when it passed none. Only before other threads exist.
  [[nodiscard]] static std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> adoptActivated();
  // Takes over a descriptor that must be a listening Unix stream socket.
  [[nodiscard]] static std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> adopt(Descriptor socket);
  // Removes the socket that bindAt() made, unless another has taken its place.
  ~UnixSocketAcceptor() override;

  [[nodiscard]] AcceptStatus accept(std::unique_ptr<Stream>& stream) override;
  [[nodiscard]] int descriptor() const override { return socket_.get(); }
  [[nodiscard]] bool activated() const { return path_.empty(); }

 private:
  static std::variant<std::unique_ptr<UnixSocketAcceptor>, Error> bindWithMode(const std::string& path,
                                                                               unsigned mode,
                                                                               std::optional<uint32_t> group);
  UnixSocketAcceptor(Descriptor socket, std::string path, uint64_t device, uint64_t inode)
      : socket_(std::move(socket)), path_(std::move(path)), device_(device), inode_(inode) {}
  const Descriptor socket_;
  const std::shared_ptr<DescriptorRoom> room_ = std::make_shared<DescriptorRoom>();
  const std::string path_;  // of the socket that this object made
  const uint64_t device_, inode_;
};

}  // namespace kyt
