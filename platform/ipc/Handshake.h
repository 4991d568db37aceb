// The handshake that comes before the first message, as two state machines without input or output of their
// own: the caller feeds the bytes that were read and writes what the machine answers.
//
// Server side: the dialects in use are AUTH EXTERNAL with an initial response, without one (the server asks
// with an empty DATA), and a bare AUTH (answered REJECTED EXTERNAL); pipelined or not; NEGOTIATE_UNIX_FD
// before BEGIN. The identity that a client claims must be its socket's; ANONYMOUS is refused. Client side:
// EXTERNAL, NEGOTIATE_UNIX_FD and BEGIN leave in one write, so that a connection costs one round trip that
// the first call does not wait for.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "platform/base/Limits.h"

namespace kyt {

// What a server that ends says instead of an answer. Clients may connect again: the next daemon takes them.
inline constexpr std::string_view kServerEnds = "ERROR \"The daemon is ending\"\r\n";

class ServerHandshake {
 public:
  enum class Status : uint8_t { goingOn, done, failed };
  // `peerUser` is what the kernel says; `guid` is 32 lower-case hexadecimal digits.
  ServerHandshake(uint32_t peerUser, std::string guid);

  // Consumes bytes of the handshake, adds the answers to `out`, and says how many bytes were consumed: all,
  // but for what follows BEGIN, which belongs to the first message. After `failed` nothing more is consumed.
  Status feed(std::span<const std::byte> bytes, size_t& consumed, std::string& out);
  [[nodiscard]] bool descriptorsAgreed() const { return descriptorsAgreed_; }
  [[nodiscard]] const char* problem() const { return problem_; }  // after failed

 private:
  enum class State : uint8_t { nul, auth, data, begin, done, failed };
  bool handleLine(std::string_view line, std::string& out);
  bool handleAuth(std::string_view arguments, std::string& out);
  bool identity(std::string_view hex, std::string& out);
  bool reject(std::string& out);
  bool fail(const char* problem);

  uint32_t peerUser_;
  std::string guid_;
  std::string line_;  // the beginning of a line whose end has not come yet
  size_t received_ = 0;
  unsigned rejections_ = 0;
  State state_ = State::nul;
  bool descriptorsAgreed_ = false;
  const char* problem_ = nullptr;
};

class ClientHandshake {
 public:
  enum class Status : uint8_t { goingOn, done, failed };
  // What to write first, all of it, before anything else: the NUL byte, AUTH EXTERNAL, NEGOTIATE_UNIX_FD,
  // BEGIN. Messages may follow at once.
  [[nodiscard]] static std::string opening(uint32_t user);
  // Consumes the server's two answers; what follows them belongs to the first message.
  Status feed(std::span<const std::byte> bytes, size_t& consumed);
  [[nodiscard]] bool descriptorsAgreed() const { return descriptorsAgreed_; }
  [[nodiscard]] const char* problem() const { return problem_; }
  [[nodiscard]] bool serverEnds() const { return serverEnds_; }  // after failed

 private:
  enum class State : uint8_t { ok, descriptors, done, failed };
  std::string line_;
  size_t received_ = 0;
  State state_ = State::ok;
  bool descriptorsAgreed_ = false;
  bool serverEnds_ = false;
  const char* problem_ = nullptr;
};

}  // namespace kyt
