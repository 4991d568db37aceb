// A socket that speaks to an IPC server byte by byte, rightly or wrongly, for the tests of the server and of
// the whole daemon. One thread; its waits end after half a minute.
#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/ipc/BodyReader.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/linux/base/Descriptors.h"
#include "tests/support/SendDescriptors.h"

namespace kyt::test {

// A client that says exactly what it is told to.
class PlainClient {
 public:
  explicit PlainClient(const std::string& path) {
    socket_ = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.data(), path.size());
    connected_ = ::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  }
  [[nodiscard]] bool connected() const { return connected_; }
  [[nodiscard]] int descriptor() const { return socket_.get(); }
  // Handshakes and leaves nothing of it to be read.
  bool shakeHands() {
    send(ClientHandshake::opening(::getuid()));
    ClientHandshake handshake;
    while (true) {
      if (!fill()) return false;
      size_t consumed = 0;
      const auto status = handshake.feed(std::as_bytes(std::span(received_)), consumed);
      received_.erase(0, consumed);
      if (status != ClientHandshake::Status::goingOn) return status == ClientHandshake::Status::done;
    }
  }
  bool send(std::string_view bytes, const std::vector<int>& descriptors = {}) {
    while (!bytes.empty()) {
      const ssize_t count = sendDescriptors(socket_.get(), bytes, descriptors);
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<size_t>(count));
      if (!descriptors.empty()) return bytes.empty() || send(bytes);
    }
    return true;
  }
  // What the writer makes of a call; the serial is the next one.
  template <typename Body>
  uint32_t call(std::string_view member, std::string_view signature, Body&& body, bool expectsReply = true,
                const std::vector<int>& descriptors = {}) {
    std::string bytes;
    MessageWriter writer(bytes);
    writer.beginCall(++serial_, {.member = member,
                                 .signature = signature,
                                 .expectsReply = expectsReply,
                                 .unixFds = static_cast<uint32_t>(descriptors.size())});
    body(writer);
    EXPECT_TRUE(writer.end());
    send(bytes, descriptors);
    return serial_;
  }
  uint32_t call(std::string_view member, bool expectsReply = true) {
    return call(
        member, "", [](MessageWriter&) {}, expectsReply);
  }
  // The next message, or none at the stream's end. It is valid until the next call of this.
  std::optional<Message> receive() {
    received_.erase(0, std::exchange(lastSize_, 0));
    while (true) {
      Message message;
      const Frame frame = readMessage(std::as_bytes(std::span(received_)), 1u << 26, message);
      if (frame.status == FrameStatus::complete) {
        lastSize_ = frame.size;
        return message;
      }
      if (frame.status != FrameStatus::incomplete || !fill()) return std::nullopt;
    }
  }
  // The string, or error name, of the next message.
  std::string receiveText() {
    const auto message = receive();
    if (!message) return "(end)";
    if (message->type == wire::MessageType::error) return std::string(message->errorName);
    BodyReader reader(*message);
    std::string_view text;
    return reader.hasSignature("s") && reader.readStringView(text) ? std::string(text)
                                                                   : std::string(message->signature);
  }
  // Nothing more comes: the server has closed.
  bool atEnd() {
    received_.erase(0, std::exchange(lastSize_, 0));
    return received_.empty() && !fill();
  }
  [[nodiscard]] std::string& received() { return received_; }
  bool fill() {
    pollfd waiting{socket_.get(), POLLIN, 0};
    if (::poll(&waiting, 1, 30000) <= 0) return false;
    char buffer[65536];
    const ssize_t count = ::recv(socket_.get(), buffer, sizeof buffer, 0);
    if (count <= 0) return false;
    received_.append(buffer, static_cast<size_t>(count));
    return true;
  }
  void halfClose() { ::shutdown(socket_.get(), SHUT_WR); }
  void close() { socket_ = Descriptor(); }

 private:
  Descriptor socket_;
  bool connected_ = false;
  uint32_t serial_ = 0;
  std::string received_;
  size_t lastSize_ = 0;
};

}  // namespace kyt::test
