// Posts that can never be taken, for a person to look at: their facts, why, and the beginning of their body, in the
// dead-letter stream. A few a second, so whoever sends rubbish fills nothing. Those that the log then has count as such
// (Delivery). Any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include "http/Http.h"
#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"
#include "receiver/EventLog.h"
#include "receiver/Figures.h"
#include "receiver/PostCheck.h"

namespace kyt::receiver {

class DeadLetters {
 public:
  DeadLetters(EventLog& log, const Clock& clock, Figures& figures);  // which outlive this

  void send(const http::Request& request, const Rejection& rejection) EXCLUDES(mutex_);
  // One that the log never takes.
  void send(const LogMessage& message, Refusal refusal) EXCLUDES(mutex_);

 private:
  [[nodiscard]] bool mayBeSent() EXCLUDES(mutex_);
  // `bytes`: of the whole body.
  void publish(std::shared_ptr<LogMessage> letter, Refusal refusal, std::string_view body, uint64_t bytes);

  EventLog& log_;
  const Clock& clock_;
  Figures& figures_;
  Mutex mutex_;
  double left_ GUARDED_BY(mutex_);
  MonotonicTime since_ GUARDED_BY(mutex_);
};

}  // namespace kyt::receiver
