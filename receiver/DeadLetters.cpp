#include "receiver/DeadLetters.h"

#include <algorithm>
#include <string>

#include "receiver/Limits.h"

namespace kyt::receiver {

DeadLetters::DeadLetters(EventLog& log, const Clock& clock, Figures& figures)
    : log_(log),
      clock_(clock),
      figures_(figures),
      left_(Limits::deadLettersAtOnce),
      since_(clock.monotonic()) {}

bool DeadLetters::mayBeSent() {
  const MonotonicTime now = clock_.monotonic();
  MutexLock lock(mutex_);
  const double seconds = std::chrono::duration<double>(now - since_).count();
  left_ = std::min<double>(left_ + seconds * Limits::deadLettersPerSecond, Limits::deadLettersAtOnce);
  since_ = now;
  if (left_ < 1) return false;
  left_ -= 1;
  return true;
}

void DeadLetters::send(const http::Request& request, const Rejection& rejection) {
  if (!mayBeSent()) return count(figures_.deadLettersLeftOut);
  const TimeValue now = clock_.timeOfDay();
  auto letter = std::make_shared<LogMessage>();
  const uint64_t bytes = std::max(request.bodySize, request.contentLength.value_or(0));
  letter->id = messageID(request.body);
  letter->headers =
      factsOf(request, letter->id, now.seconds * 1000 + now.microseconds / 1000, /*hasDigest=*/false);
  // Of a part of it that is nobody's name.
  if (request.body.size() != bytes) letter->headers.erase(letter->headers.begin());
  publish(std::move(letter), rejection.refusal, request.body, bytes);
}

void DeadLetters::send(const LogMessage& message, Refusal refusal) {
  if (!mayBeSent()) return count(figures_.deadLettersLeftOut);
  auto letter = std::make_shared<LogMessage>();
  letter->id = message.id;
  letter->headers = message.headers;
  publish(std::move(letter), refusal, message.body, message.body.size());
}

void DeadLetters::publish(std::shared_ptr<LogMessage> letter, Refusal refusal, std::string_view body,
                          uint64_t bytes) {
  letter->headers.emplace_back("Kyt-Reason", refusalName(refusal));
  letter->headers.emplace_back("Kyt-Bytes", std::to_string(bytes));
  letter->body = body.substr(0, Limits::maxDeadLetterBytes);
  log_.publishDeadLetter(std::move(letter));
}

}  // namespace kyt::receiver
