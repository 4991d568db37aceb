// The reading half of DBusConnection: one turn on the connection's queue.
#include <utility>

#include "platform/base/Allocation.h"
#include "platform/base/Clock.h"
#include "platform/base/Limits.h"
#include "platform/ipc/DBusConnection.h"
#include "platform/queues/LineLimits.h"

namespace kyt {
namespace {

constexpr unsigned kManyCalls = 16;
constexpr const char* kTooManyBytes = "its user's clients hold too many bytes";

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
  const LineOrder::Scope lines(lines_);
  turnScheduled_ = false;
  if (life_.reached(Life::closed)) return;
  if (life_.reached(Life::ended)) {
    // Only what is queued still keeps the connection.
    if (output_->finish() || hurried_) closeStream();
    return;
  }
  Step step = Step::stopped;
  {
    Turn deferring;
    HeldOutput held(deferring, *output_);
    Progress progress;
    progress.begin = context_->services.clock.monotonic();
    step = runSteps(progress);
    if (step == Step::broken || step == Step::ended || step == Step::stopped) end(step);
  }
  if (step == Step::more) scheduleTurn();
  if (step == Step::drained) armWatch(ready::readable);
  if (step == Step::drained || step == Step::paused) watchBegunMessage();
}

void DBusConnection::watchBegunMessage() {
  if (patience_.running() || kept_.empty() || handshake_ || life_.reached(Life::ended)) return;
  patience_.begin(Limits::messageTime, queue_, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->queue_->assertCurrent();
    self->messageTookTooLong();
  });
}

void DBusConnection::messageTookTooLong() {
  const ClientScope scope(user_);
  const bool stalled = patience_.ranOut();
  if (life_.reached(Life::stopping)) return;
  // A client that is not read from cannot finish its message.
  if (!stalled || kept_.empty() || mustPause()) return watchBegunMessage();
  breakOff(Reason::messageTimedOut, "the rest of a message did not come");
  end(Step::broken);
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

void DBusConnection::Progress::countCall(const Clock& clock) {
  ++calls;
  const bool looks = calls % Limits::turnTimeCalls == 0;
  over = calls >= Limits::turnCalls || (looks && clock.monotonic() - begin >= Limits::turnTime);
}

// Looks at what was kept, when that may hold a message, or else reads once; handles what there is.
DBusConnection::Step DBusConnection::step(std::span<std::byte> buffer, Progress& progress) {
  const bool finishing = life_.reached(Life::finishing);
  if (life_.reached(Life::stopping) || (finishing && memoryWasRefused())) return Step::stopped;
  if (mustPause()) return Step::paused;
  std::span<const std::byte> bytes;
  Step after = Step::more;
  if (kept_.mayHoldMessage()) {
    bytes = kept_.bytes();
  } else {
    if (finishing) return Step::stopped;
    const size_t before = kept_.copyTo(buffer);
    size_t read = 0;
    after = readMore(buffer.subspan(before), read);
    if (read == 0) return after;
    progress.bytes += read;
    if (before == kept_.bytes().size()) {
      bytes = buffer.first(before + read);
    } else {
      if (!kept_.append(buffer.first(read))) return breakOff(Reason::userBytesExceeded, kTooManyBytes);
      if (!kept_.mayHoldMessage()) return after;
      bytes = kept_.bytes();
    }
  }
  size_t consumed = 0;
  const unsigned before = progress.calls;
  const Step handled = handleBytes(bytes, consumed, progress);
  const bool keeps = kept_.keep(bytes.subspan(consumed));
  if (kept_.empty()) descriptors_.clear();  // no message claimed them
  if (handled == Step::broken || handled == Step::stopped) return handled;
  if (!keeps) return breakOff(Reason::userBytesExceeded, kTooManyBytes);
  if (handled != Step::more) return handled;
  // A client that sent many calls has mostly sent more meanwhile: looking costs less than being told.
  const bool mayHaveMore = after == Step::drained && progress.calls - before >= kManyCalls;
  return kept_.mayHoldMessage() || mayHaveMore ? Step::more : after;
}

bool DBusConnection::mustPause() const {
  return !hurried_ && !life_.reached(Life::finishing) && (output_->paused() || memoryWasRefused());
}

// One read. A read that did not fill the buffer has emptied the socket, unless descriptors came with it,
// where the kernel stops; the reactor reports at once what came since.
DBusConnection::Step DBusConnection::readMore(std::span<std::byte> buffer, size_t& bytes) {
  std::vector<Descriptor> received;
  const StreamResult result = stream_->read(buffer, received);
  const bool stopsEarly = !received.empty();
  if (!descriptors_.add(std::move(received)))
    return breakOff(Reason::tooManyDescriptorsOfUser, "its user's clients hold too many descriptors");
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

DBusConnection::Step DBusConnection::handleBytes(std::span<const std::byte> bytes, size_t& consumed,
                                                 Progress& progress) {
  while (consumed < bytes.size()) {
    size_t taken = 0;
    const Step step = handshake_ ? handleHandshake(bytes.subspan(consumed), taken)
                                 : handleMessage(bytes.subspan(consumed), taken, progress.header);
    consumed += taken;
    if (step != Step::more) return step;
    if (taken == 0) break;  // not a whole message
    kept_.need(0);
    patience_.sawProgress();
    progress.countCall(context_->services.clock);
    if (life_.reached(Life::stopping)) return Step::stopped;
    if (mustPause()) return Step::paused;
    if (progress.over) break;
  }
  if (kept_.needsMore() && descriptors_.tooManyForOneMessage())
    return breakOff(Reason::malformedMessage, "more descriptors came than a message may carry");
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
      descriptors_.agree(handshake_->descriptorsAgreed());
      handshake_.reset();
      handshakeTimer_.cancel();
      life_.advance(Life::open);
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
      kept_.need(frame.size);
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
    if (const char* problem = descriptors_.take(message.unixFds, taken))
      return breakOff(Reason::malformedMessage, problem);
  }
  consumed = frame.size;
  const char* problem = context_->dispatcher->handle(message, {.object = *exportedObject_,
                                                               .output = output_,
                                                               .descriptors = taken,
                                                               .connectionNumber = number_,
                                                               .stream = stream_.get()});
  return problem == nullptr ? Step::more : breakOff(Reason::malformedMessage, problem);
}

}  // namespace kyt
