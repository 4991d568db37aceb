// The reading half of DBusConnection: one turn on the connection's queue.
#include <cstring>
#include <utility>

#include "platform/base/Clock.h"
#include "platform/base/Limits.h"
#include "platform/ipc/DBusConnection.h"
#include "platform/queues/LineLimits.h"

namespace kyt {
namespace {

constexpr unsigned kManyCalls = 16;

// Gathers the replies of a turn; gives them up early when the thread is about to block.
class HeldOutput {
 public:
  HeldOutput(Turn& turn, ConnectionOutput& output) : turn_(turn), output_(output) {
    output_.hold();
    turn_.setBeforeBlocking([&output] { output.release(); });
  }
  ~HeldOutput() {
    turn_.runDeferred();
    turn_.setBeforeBlocking(nullptr);
    output_.release();
  }
  HeldOutput(const HeldOutput&) = delete;
  HeldOutput& operator=(const HeldOutput&) = delete;

 private:
  Turn& turn_;
  ConnectionOutput& output_;
};

}  // namespace

void DBusConnection::turn() {
  const ClientScope scope(user_);
  turnScheduled_ = false;
  if (closed()) return;
  if (ended_) {
    // Only what is queued still keeps the connection.
    if (output_->finish() || peerGone_ || hurried_) closeStream();
    return;
  }
  if (!started_) {
    if (finishing_) end(false, true);
    return;
  }
  Step step = Step::stopped;
  {
    Turn deferring;
    HeldOutput held(deferring, *output_);
    Progress progress;
    progress.begin = context_->services.clock.monotonic();
    step = runSteps(progress);
    if (step == Step::broken || step == Step::ended) end(step == Step::broken, false);
    if (step == Step::stopped) end(false, finishing_ && !hurried_);
  }
  if (step == Step::more) scheduleTurn();
  if (step == Step::drained) armRead();
  if (step == Step::drained || step == Step::paused) watchBegunMessage();
}

// One timer at a time looks whether the message that was unfinished when it was set still is. So an unfinished one ends
// its connection after once to twice the time, and a client that sends without a pause costs a timer now and then.
void DBusConnection::watchBegunMessage() {
  if (messageTimed_ || ended_ || kept_.empty() || handshake_) return;
  messageTimed_ = true;
  timedMessages_ = messages_;
  const auto patience =
      std::chrono::duration_cast<Duration>(std::chrono::duration<double>(Limits::messageSeconds));
  messageTimer_ = context_->services.timers.after(patience, queue_, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->queue_->assertCurrent();
    self->messageTookTooLong();
  });
}

void DBusConnection::messageTookTooLong() {
  const ClientScope scope(user_);
  messageTimed_ = false;
  if (ended_ || closed()) return;
  // A client that is not read from cannot finish its message.
  if (timedMessages_ != messages_ || kept_.empty() || mustPause()) return watchBegunMessage();
  breakOff(Reason::messageTimedOut, "the rest of a message did not come");
  end(true, false);
}

DBusConnection::Step DBusConnection::runSteps(Progress& progress) {
  ReadBuffers::Buffer buffer = context_->buffers.take();
  Step result = Step::more;
  while (result == Step::more && !progress.over && progress.bytes < Limits::turnBytes) {
    result = step({buffer.get(), ReadBuffers::kBytes}, progress);
  }
  context_->buffers.give(std::move(buffer));
  return result;
}

void DBusConnection::countCall(Progress& progress) const {
  ++progress.calls;
  const bool looks = progress.calls % Limits::turnTimeCalls == 0;
  progress.over = progress.calls >= Limits::turnCalls ||
                  (looks && context_->services.clock.monotonic() - progress.begin >= Limits::turnTime);
}

// Looks at what was kept, when that may hold a message, or else reads once; handles what there is.
DBusConnection::Step DBusConnection::step(std::span<std::byte> buffer, Progress& progress) {
  if (invalidating_) return Step::stopped;
  if (mustPause()) return Step::paused;
  std::string large;
  std::span<const std::byte> bytes;
  Step after = Step::more;
  if (!kept_.empty() && kept_.size() >= needed_) {
    large = std::exchange(kept_, std::string());
    bytes = std::as_bytes(std::span(large));
  } else {
    if (finishing_) return Step::stopped;
    const size_t before = kept_.size() <= buffer.size() / 2 ? kept_.size() : 0;
    std::memcpy(buffer.data(), kept_.data(), before);
    size_t read = 0;
    after = readMore(buffer.subspan(before), read);
    if (read == 0) return after;
    progress.bytes += read;
    if (before == kept_.size()) {
      kept_.clear();
      bytes = buffer.first(before + read);
    } else {
      if (!keptCharge_.set(kept_.size() + read)) return tooManyBytes();
      kept_.append(reinterpret_cast<const char*>(buffer.data()), read);
      if (kept_.size() < needed_) return after;
      large = std::exchange(kept_, std::string());
      bytes = std::as_bytes(std::span(large));
    }
  }
  size_t consumed = 0;
  const unsigned before = progress.calls;
  const Step handled = handleBytes(bytes, consumed, progress);
  const Step kept = keepRest(bytes.subspan(consumed));
  if (handled == Step::broken || handled == Step::stopped) return handled;
  if (kept != Step::more) return kept;
  if (handled != Step::more) return handled;
  const bool leftWhole = !kept_.empty() && kept_.size() >= needed_;
  // A client that sent many calls has mostly sent more meanwhile: looking costs less than being told.
  const bool mayHaveMore = after == Step::drained && progress.calls - before >= kManyCalls;
  return leftWhole || mayHaveMore ? Step::more : after;
}

bool DBusConnection::mustPause() const {
  return !finishing_ && !peerGone_ && output_->paused();
}

// One read. A read that did not fill the buffer has emptied the socket, unless descriptors came with it,
// where the kernel stops; the reactor reports at once what came since.
DBusConnection::Step DBusConnection::readMore(std::span<std::byte> buffer, size_t& bytes) {
  std::vector<Descriptor> received;
  const StreamResult result = stream_->read(buffer, received);
  const bool stopsEarly = !received.empty();
  // During the handshake they may belong to a message behind it, of which this read has the beginning.
  if (descriptorsAgreed_ || handshake_) {
    for (Descriptor& descriptor : received) descriptors_.push_back(std::move(descriptor));
    if (!descriptorsCharge_.set(descriptors_.size()))
      return breakOff(Reason::tooManyDescriptorsOfUser, "its user's clients hold too many descriptors");
  }
  switch (result.status) {
    case StreamStatus::ok:
      bytes = result.bytes;
      return bytes < buffer.size() && !stopsEarly ? Step::drained : Step::more;
    case StreamStatus::wouldBlock:
      return Step::drained;
    case StreamStatus::ended:
      return kept_.empty() ? Step::ended : Step::broken;
    case StreamStatus::truncated:
      return breakOff(Reason::malformedMessage, "more descriptors came than a message may carry");
    case StreamStatus::failed:
      break;
  }
  return Step::broken;
}

DBusConnection::Step DBusConnection::tooManyBytes() {
  return breakOff(Reason::userBytesExceeded, "its user's clients hold too many bytes");
}

// Keeps what was not handled, in a block of exactly its size, and closes descriptors that no message claimed.
DBusConnection::Step DBusConnection::keepRest(std::span<const std::byte> rest) {
  if (rest.empty()) {
    kept_ = std::string();
    keptCharge_.clear();
    needed_ = 0;
    if (!descriptors_.empty()) {
      descriptors_.clear();
      descriptorsCharge_.clear();
    }
    return Step::more;
  }
  if (!keptCharge_.set(rest.size() > Limits::freeBytes ? rest.size() : 0)) return tooManyBytes();
  kept_ = std::string(reinterpret_cast<const char*>(rest.data()), rest.size());
  return Step::more;
}

DBusConnection::Step DBusConnection::handleBytes(std::span<const std::byte> bytes, size_t& consumed,
                                                 Progress& progress) {
  while (consumed < bytes.size()) {
    size_t taken = 0;
    const Step step = handshake_ ? handleHandshake(bytes.subspan(consumed), taken)
                                 : handleMessage(bytes.subspan(consumed), taken, progress.header);
    consumed += taken;
    if (step != Step::more) return step;
    if (taken == 0) break;  // not a whole message
    needed_ = 0;
    ++messages_;
    countCall(progress);
    if (invalidating_) return Step::stopped;
    if (mustPause()) return Step::paused;
    if (progress.over) break;
  }
  if (descriptors_.size() > Limits::maxDescriptorsPerMessage && needed_ != 0) {
    return breakOff(Reason::malformedMessage, "more descriptors came than a message may carry");
  }
  return Step::more;
}

DBusConnection::Step DBusConnection::handleHandshake(std::span<const std::byte> bytes, size_t& consumed) {
  std::string answers;
  const ServerHandshake::Status status = handshake_->feed(bytes, consumed, answers);
  if (!answers.empty()) output_->sendHandshake(answers);
  switch (status) {
    case ServerHandshake::Status::goingOn:
      break;
    case ServerHandshake::Status::failed:
      return breakOff(Reason::handshakeFailed, handshake_->problem());
    case ServerHandshake::Status::done:
      descriptorsAgreed_ = handshake_->descriptorsAgreed();
      if (!descriptorsAgreed_) {
        descriptors_.clear();
        descriptorsCharge_.clear();
      }
      handshake_.reset();
      handshakeTimer_.cancel();
      output_->open();
      break;
  }
  return Step::more;
}

DBusConnection::Step DBusConnection::handleMessage(std::span<const std::byte> bytes, size_t& consumed,
                                                   HeaderMemory& header) {
  Message message;
  const Frame frame = readMessage(bytes, context_->services.limits.maxMessageBytes, message, &header);
  switch (frame.status) {
    case FrameStatus::incomplete:
      needed_ = frame.size;
      return Step::more;
    case FrameStatus::tooLong:
      return breakOff(Reason::messageTooLong, frame.problem);
    case FrameStatus::malformed:
      return breakOff(Reason::malformedMessage, frame.problem);
    case FrameStatus::skip:
      consumed = frame.size;
      return Step::more;
    case FrameStatus::complete:
      break;
  }
  std::vector<Descriptor> taken;
  if (message.unixFds != 0) {
    const Step step = takeDescriptors(message, taken);
    if (step != Step::more) return step;
  }
  consumed = frame.size;
  const char* problem = context_->dispatcher.handle(message, {.session = *exportedObject_,
                                                              .output = output_,
                                                              .descriptors = taken,
                                                              .connectionNumber = number_,
                                                              .stream = stream_.get()});
  return problem == nullptr ? Step::more : breakOff(Reason::malformedMessage, problem);
}

DBusConnection::Step DBusConnection::takeDescriptors(const Message& message, std::vector<Descriptor>& taken) {
  if (message.unixFds > Limits::maxDescriptorsPerMessage) {
    return breakOff(Reason::malformedMessage, "a message claims more descriptors than it may carry");
  }
  if (message.unixFds > descriptors_.size()) {
    return breakOff(Reason::malformedMessage, "a message claims descriptors that did not come");
  }
  const auto end = descriptors_.begin() + message.unixFds;
  taken.assign(std::make_move_iterator(descriptors_.begin()), std::make_move_iterator(end));
  descriptors_.erase(descriptors_.begin(), end);
  descriptorsCharge_.setAnyway(descriptors_.size());  // less than before
  return Step::more;
}

}  // namespace kyt
