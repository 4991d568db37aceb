#include "client/Connection.h"

#include <algorithm>
#include <span>
#include <utility>

#include "platform/ipc/MessageReader.h"

namespace kyt::client {

namespace {

using linux_client::ClientSocket;
using linux_client::Outcome;
using std::chrono::milliseconds;

constexpr uint64_t kMaxReplyBytes = 64u << 20;
constexpr milliseconds kFirstBackoff{100}, kLastBackoff{5000};
constexpr int kReads = 16;  // of 64 KiB, before what they brought is handled
// Connections in a row that end before the daemon's first byte. It tells a client that it refuses nothing; one
// such end may be the daemon's own.
constexpr unsigned kRefusals = 2;

}  // namespace

std::string Connection::opening() {
  return ClientHandshake::opening(linux_client::effectiveUser());
}

void Connection::tryLater(SteadyTime now) {
  backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
  nextAttempt_ = now + backoff_;
}

bool Connection::open(SteadyTime now, std::string& problem) {
  ClientSocket made;
  const Outcome outcome = ClientSocket::connect(path_, made, problem);
  if (outcome != Outcome::done) {
    foundNobody_ = outcome == Outcome::ended;
    endedInHandshake_ = 0;
    tryLater(now);
    return false;
  }
  socket_ = std::move(made);
  handshake_ = ClientHandshake();
  taken_ = false;
  return true;
}

bool Connection::read() {
  Outcome outcome = Outcome::done;
  for (int reads = 0; reads < kReads && outcome == Outcome::done; ++reads) outcome = socket_.read(in_);
  return outcome != Outcome::ended;
}

const char* Connection::shakeHands() {
  if (taken_ || in_.empty()) return nullptr;
  size_t consumed = 0;
  const auto status = handshake_.feed(std::as_bytes(std::span(in_)).subspan(at_), consumed);
  at_ += consumed;
  if (status == ClientHandshake::Status::failed) {
    daemonEnds_ = handshake_.serverEnds();
    if (!daemonEnds_) endedInHandshake_ = kRefusals;
    return handshake_.problem();
  }
  if (status != ClientHandshake::Status::done) return nullptr;
  taken_ = everTaken_ = true;
  foundNobody_ = false;
  endedInHandshake_ = 0;
  backoff_ = milliseconds(0);
  return nullptr;
}

Connection::Next Connection::next(Message& message) {
  while (at_ < in_.size()) {
    const Frame frame = readMessage(std::as_bytes(std::span(in_)).subspan(at_), kMaxReplyBytes, message);
    if (frame.status == FrameStatus::incomplete) return Next::none;
    if (frame.status == FrameStatus::tooLong || frame.status == FrameStatus::malformed)
      return Next::malformed;
    at_ += frame.size;
    if (frame.status == FrameStatus::complete) return Next::message;
  }
  return Next::none;
}

void Connection::forgetHandled() {
  in_.erase(0, std::exchange(at_, 0));
}

Connection::End Connection::end(SteadyTime now, std::string& reason) {
  End ended;
  ended.taken = std::exchange(taken_, false);
  // A daemon that ends says so, and the next one takes the connection; one that cannot say so any more, or refuses,
  // is silent.
  if (std::exchange(daemonEnds_, false))
    endedInHandshake_ = 0;
  else if (!ended.taken)
    foundNobody_ = ++endedInHandshake_ >= kRefusals;
  ended.refused = !ended.taken && foundNobody_;
  reason = path_ + ": " + reason;
  if (ended.refused)
    reason +=
        ": the daemon refuses this user and program (kytctl entitlements check says why), or has too many "
        "connections";
  socket_.close();
  in_.clear();
  at_ = 0;
  tryLater(now);
  return ended;
}

}  // namespace kyt::client
