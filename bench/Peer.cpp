#include "bench/Peer.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <span>
#include <utility>

#include "bench/Corpus.h"
#include "platform/ipc/BodyReader.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"

namespace kyt::bench {

Peer::Peer(Peer&& other) noexcept : fd_(std::exchange(other.fd_, -1)), in_(std::move(other.in_)) {}

Peer& Peer::operator=(Peer&& other) noexcept {
  std::swap(fd_, other.fd_);
  std::swap(in_, other.in_);
  return *this;
}

Peer::~Peer() {
  if (fd_ >= 0) close(fd_);
}

std::optional<Peer> Peer::open(const std::string& socketPath, uint32_t sessionID) {
  Peer peer;
  peer.fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
  if (connect(peer.fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
    return std::nullopt;
  if (!peer.send(openingCalls(sessionID))) return std::nullopt;
  ClientHandshake handshake;
  for (;;) {
    size_t consumed = 0;
    const auto status = handshake.feed(std::as_bytes(std::span(peer.in_)), consumed);
    peer.in_.erase(0, consumed);
    if (status == ClientHandshake::Status::failed) return std::nullopt;
    if (status == ClientHandshake::Status::done) break;
    std::array<char, 4096> bytes;
    const ssize_t got = recv(peer.fd_, bytes.data(), bytes.size(), 0);
    if (got <= 0) return std::nullopt;
    peer.in_.append(bytes.data(), static_cast<size_t>(got));
  }
  if (!peer.awaitReply(2)) return std::nullopt;
  return peer;
}

bool Peer::send(std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t sent = ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (sent <= 0) return false;
    bytes.remove_prefix(static_cast<size_t>(sent));
  }
  return true;
}

bool Peer::awaitReply(uint32_t serial) {
  for (;;) {
    Message message;
    const Frame frame = readMessage(std::as_bytes(std::span(in_)), 1u << 26, message);
    if (frame.status == FrameStatus::complete) {
      const bool found = message.replySerial == serial;
      bool live = message.type == wire::MessageType::methodReturn;
      if (found && message.signature == "aas") {
        BodyReader reader(message);
        std::optional<Array> states;
        live = reader.readOptionalStrings(states) && states && !states->empty();
      }
      in_.erase(0, frame.size);
      if (found) return live;
      continue;
    }
    if (frame.status != FrameStatus::incomplete) return false;
    std::array<char, 65536> bytes;
    const ssize_t got = recv(fd_, bytes.data(), bytes.size(), 0);
    if (got <= 0) return false;
    in_.append(bytes.data(), static_cast<size_t>(got));
  }
}

bool Peer::call(std::string_view interface, std::string_view member, std::string out) {
  MessageWriter writer(out);
  MessageWriter::Call call;
  call.interface = interface;
  call.member = member;
  writer.beginCall(77777, call);
  return writer.end() && send(out) && awaitReply(77777);
}

bool Peer::ping() {
  return call(wire::kPeerInterface, "Ping");
}
bool Peer::sendAndPing(std::string bytes) {
  return call(wire::kPeerInterface, "Ping", std::move(bytes));
}
bool Peer::flush() {
  return call(wire::kSessionInterface, "FlushMessagesWithCompletion");
}

}  // namespace kyt::bench
