#include "platform/ipc/Handshake.h"

#include <charconv>
#include <utility>

#include "platform/base/Hex.h"

namespace kyt {
namespace {

// Rejections after which a client is only guessing.
constexpr unsigned kMaxRejections = 8;

// Takes one line, without its CR LF, out of `bytes`; keeps a beginning in `partial`. False: no whole line
// yet.
bool takeLine(std::span<const std::byte> bytes, size_t& at, std::string& partial, std::string& line) {
  while (at < bytes.size()) {
    const char c = static_cast<char>(bytes[at++]);
    partial.push_back(c);
    if (c == '\n' && partial.size() >= 2 && partial[partial.size() - 2] == '\r') {
      partial.resize(partial.size() - 2);
      line = std::exchange(partial, std::string());
      return true;
    }
  }
  return false;
}

// The command and what follows it, without the blanks between.
std::string_view takeWord(std::string_view& text) {
  const size_t end = text.find(' ');
  const std::string_view word = text.substr(0, end);
  text = end == std::string_view::npos ? std::string_view() : text.substr(end + 1);
  while (!text.empty() && text.front() == ' ') text.remove_prefix(1);
  return word;
}

// The user whose number, in ASCII digits, was sent in hexadecimal.
bool decodeUser(std::string_view hex, uint32_t& user) {
  if (hex.empty() || hex.size() % 2 != 0 || hex.size() > 20) return false;
  std::string digits;
  for (size_t i = 0; i < hex.size(); i += 2) {
    const int high = hexDigit(hex[i]), low = hexDigit(hex[i + 1]);
    if (high < 0 || low < 0) return false;
    digits.push_back(static_cast<char>(high * 16 + low));
  }
  const char* const end = digits.data() + digits.size();
  const auto [stopped, error] = std::from_chars(digits.data(), end, user);
  return error == std::errc() && stopped == end;
}

}  // namespace

ServerHandshake::ServerHandshake(uint32_t peerUser, std::string guid)
    : peerUser_(peerUser), guid_(std::move(guid)) {}

bool ServerHandshake::fail(const char* problem) {
  state_ = State::failed;
  problem_ = problem;
  return false;
}

bool ServerHandshake::reject(std::string& out) {
  if (++rejections_ > kMaxRejections) return fail("too many attempts to authenticate");
  out.append("REJECTED EXTERNAL\r\n");
  state_ = State::auth;
  return true;
}

// An empty claim means the socket's own identity.
bool ServerHandshake::identity(std::string_view hex, std::string& out) {
  uint32_t user = 0;
  if (!hex.empty() && (!decodeUser(hex, user) || user != peerUser_)) return reject(out);
  out.append("OK ").append(guid_).append("\r\n");
  state_ = State::begin;
  return true;
}

bool ServerHandshake::handleAuth(std::string_view arguments, std::string& out) {
  const std::string_view mechanism = takeWord(arguments);
  if (mechanism != "EXTERNAL") return reject(out);
  if (!arguments.empty()) return identity(arguments, out);
  out.append("DATA\r\n");
  state_ = State::data;
  return true;
}

bool ServerHandshake::handleLine(std::string_view line, std::string& out) {
  std::string_view arguments = line;
  const std::string_view command = takeWord(arguments);
  if (command == "BEGIN") {
    if (state_ != State::begin) return fail("BEGIN before authentication");
    state_ = State::done;
    return true;
  }
  if (command == "AUTH") {
    if (state_ == State::auth) return handleAuth(arguments, out);
  } else if (command == "DATA") {
    if (state_ == State::data) return identity(arguments, out);
  } else if (command == "CANCEL" || command == "ERROR") {
    return reject(out);
  } else if (command == "NEGOTIATE_UNIX_FD" && state_ == State::begin) {
    descriptorsAgreed_ = true;
    out.append("AGREE_UNIX_FD\r\n");
    return true;
  }
  if (++rejections_ > kMaxRejections) return fail("too many commands that are not understood");
  out.append("ERROR \"Not understood\"\r\n");
  return true;
}

ServerHandshake::Status ServerHandshake::feed(std::span<const std::byte> bytes, size_t& consumed,
                                              std::string& out) {
  consumed = 0;
  std::string line;
  while (consumed < bytes.size() && state_ != State::done && state_ != State::failed) {
    if (state_ == State::nul) {
      if (bytes[consumed++] != std::byte{0}) {
        fail("the first byte is not NUL");
        break;
      }
      ++received_;
      state_ = State::auth;
      continue;
    }
    // What follows BEGIN is not counted, though it may have come in the same read.
    const size_t before = consumed;
    const size_t allowed = before + (Limits::maxHandshakeBytes - received_);
    const bool whole =
        takeLine(bytes.first(allowed < bytes.size() ? allowed : bytes.size()), consumed, line_, line);
    received_ += consumed - before;
    if (whole) {
      handleLine(line, out);
    } else if (received_ >= Limits::maxHandshakeBytes) {
      fail("the handshake is too long");
    }
  }
  if (state_ == State::failed) return Status::failed;
  return state_ == State::done ? Status::done : Status::goingOn;
}

std::string ClientHandshake::opening(uint32_t user) {
  std::string text(1, '\0');
  text.append("AUTH EXTERNAL ");
  appendHex(std::to_string(user), text);
  text.append("\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n");
  return text;
}

ClientHandshake::Status ClientHandshake::feed(std::span<const std::byte> bytes, size_t& consumed) {
  consumed = 0;
  std::string line;
  while (consumed < bytes.size() && state_ != State::done && state_ != State::failed) {
    const size_t before = consumed;
    const size_t allowed = before + (Limits::maxHandshakeBytes - received_);
    const bool whole =
        takeLine(bytes.first(allowed < bytes.size() ? allowed : bytes.size()), consumed, line_, line);
    received_ += consumed - before;
    if (!whole) {
      if (received_ >= Limits::maxHandshakeBytes) {
        state_ = State::failed;
        problem_ = "the server's handshake is too long";
      }
      continue;
    }
    std::string_view arguments = line;
    const std::string_view command = takeWord(arguments);
    if (state_ == State::ok && command == "OK") {
      state_ = State::descriptors;
    } else if (state_ == State::descriptors && (command == "AGREE_UNIX_FD" || command == "ERROR")) {
      descriptorsAgreed_ = command == "AGREE_UNIX_FD";
      state_ = State::done;
    } else {
      state_ = State::failed;
      serverEnds_ = line + "\r\n" == kServerEnds;
      problem_ = serverEnds_             ? "the daemon is ending"
                 : command == "REJECTED" ? "the server rejected the user"
                                         : "the server's handshake is not understood";
    }
  }
  if (state_ == State::failed) return Status::failed;
  return state_ == State::done ? Status::done : Status::goingOn;
}

}  // namespace kyt
