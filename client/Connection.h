// A session's connection to the daemon, and when the next one is tried: a tenth of a second after one has failed or ended,
// then after twice as long each time, five seconds at most. What attempts, handshakes and ends say of the daemon is
// concluded here: whether anybody is there, and whether it refuses this program. The library's thread only; nothing blocks.
#pragma once

#include <chrono>
#include <cstddef>
#include <string>

#include "client/Command.h"
#include "platform/ipc/Handshake.h"
#include "platform/linux/client/ClientSocket.h"

namespace kyt {
struct Message;
}

namespace kyt::client {

class Connection {
 public:
  // Of the daemon's socket.
  explicit Connection(std::string path) : path_(std::move(path)) {}

  [[nodiscard]] bool isOpen() const { return socket_.isOpen(); }
  // The handshake is done: calls may be sent. Stays so after close().
  [[nodiscard]] bool isTaken() const { return taken_; }
  [[nodiscard]] bool passesDescriptors() const { return handshake_.descriptorsAgreed(); }
  // A daemon once completed a handshake.
  [[nodiscard]] bool wasEverTaken() const { return everTaken_; }
  // The last attempt found no daemon, or one that refuses.
  [[nodiscard]] bool foundNobody() const { return foundNobody_; }
  [[nodiscard]] const std::string& path() const { return path_; }
  [[nodiscard]] linux_client::ClientSocket& socket() { return socket_; }
  [[nodiscard]] int fd() const { return socket_.fd(); }

  [[nodiscard]] SteadyTime nextAttempt() const { return nextAttempt_; }
  void setNextAttempt(SteadyTime when) { nextAttempt_ = when; }
  // Connects; then the bytes of opening() are to leave first. False: why not is in `problem`.
  [[nodiscard]] bool open(SteadyTime now, std::string& problem);
  [[nodiscard]] static std::string opening();

  // Takes in what the daemon has sent, up to a megabyte. False: the connection has ended.
  [[nodiscard]] bool read();
  // Reads the daemon's side of the handshake in it, while there is one; what is wrong, or null.
  [[nodiscard]] const char* shakeHands();
  // The next whole message in it, valid until forgetHandled() or end().
  enum class Next : uint8_t { message, none, malformed };
  [[nodiscard]] Next next(Message& message);
  // Frees the bytes of the messages that were returned.
  void forgetHandled();

  // It has ended, or is of no use any more. Puts what can be known into `reason`.
  struct End {
    bool taken = false;    // the handshake was done
    bool refused = false;  // the daemon does not serve this program
  };
  End end(SteadyTime now, std::string& reason);
  // The session has ended.
  void close() { socket_.close(); }

 private:
  void tryLater(SteadyTime now);

  const std::string path_;
  linux_client::ClientSocket socket_;
  ClientHandshake handshake_;
  bool taken_ = false, everTaken_ = false, foundNobody_ = false;
  bool daemonEnds_ = false;        // it said so in the handshake
  unsigned endedInHandshake_ = 0;  // connections in a row
  std::string in_;
  size_t at_ = 0;  // what is before was handled
  SteadyTime nextAttempt_{};
  std::chrono::milliseconds backoff_{0};
};

}  // namespace kyt::client
