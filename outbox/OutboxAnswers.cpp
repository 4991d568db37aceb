// What the outbox makes of servers' answers, to what it sends again and to new posts.
#include <utility>

#include "outbox/Outbox.h"
#include "platform/base/Limits.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

constexpr int kTooManyRequests = 429, kServiceUnavailable = 503;

}  // namespace

void Outbox::take(Answer& answer) {
  Sending& sending = *answer.sending;
  ServerLine& line = *sending.line;
  --line.inFlight;
  bytesInFlight_ -= sending.bytes;
  for (ServerLine::Sender& sender : line.senders)
    if (sender.session == sending.session) --sender.inFlight;
  inFlight_.erase(sending.number);
  line.isPrompt = ports_.clock.monotonic() - sending.since < Limits::outboxSlowAnswer;
  if (answer.mayHaveLeft) tellOwner(sending.url, sending.events, sending.bodyBytes, !answer.isUnanswered);
  KeptPosts::Entry* entry = sending.isAbandoned ? nullptr : posts_.find(sending.number);
  if (entry == nullptr) return;
  posts_.setInFlight(*entry, false);
  line.lastStatus = answer.status;
  if (answer.verdict == PostVerdict::sendAgain) {
    if (!isStopping_) failAgain(*entry, answer);
    return;
  }
  if (answer.verdict == PostVerdict::taken) {
    if (line.failures > 1) ports_.log.normal("Outbox: %s takes posts again", line.server.c_str());
    line.isOpen = true;
    books_.deliver(sending.number, sending.events, answer.status);
  } else {
    const bool isRedirected = answer.verdict == PostVerdict::redirected;
    ports_.counters.add(isRedirected ? Reason::requestRedirected : Reason::requestRefused);
    books_.drop(sending.number, sending.events, isRedirected ? Reason::postRedirected : Reason::postRefused,
                answer.status);
  }
  removed_.push_back(sending.number);
  posts_.remove(*entry);
  if (answer.verdict == PostVerdict::braked) return fail(line, answer.retryAfter, false);
  line.failures = line.hastened = 0;
  line.isHastened = false;
  setNextTry(line, ports_.clock.monotonic());
  takes(line);
}

// A post that never left is not the reason itself: it stays the first. Of one that did nobody knows, so the next one is
// tried; a post that its server alone does not take holds nobody up.
void Outbox::failAgain(KeptPosts::Entry& entry, const Answer& answer) {
  ServerLine& line = *entry.line;
  const bool saysSomething =
      !answer.mayHaveLeft || posts_.standAside(entry, ports_.clock.monotonic(),
                                               [this](unsigned strikes) { return pauseAfter(strikes); });
  if (saysSomething)
    fail(line, answer.retryAfter, answer.isUnanswered);
  else if (!answer.retryAfter)
    return;
  else if (answer.status == kTooManyRequests || answer.status == kServiceUnavailable)
    pause(line, *answer.retryAfter);  // these speak of the whole server
  else
    KeptPosts::delay(entry, ports_.clock.monotonic() + *answer.retryAfter);
}

void Outbox::takes(ServerLine& line) {
  line.newStrikes = 0;
  KeptPosts::comeBack(line);
}

// The programs' parts of a message are as large as they have events.
void Outbox::tellOwner(const std::string& url, const OutboxBooks::Events& events, uint64_t bodyBytes,
                       bool isAnswered) {
  uint64_t all = 0;
  for (const auto& [row, count] : events) all += count;
  for (const auto& [row, count] : events)
    ports_.departures.add({.program = row.program,
                           .server = serverOf(url),
                           .kind = DepartureKind::events,
                           .events = count,
                           .bytes = all != 0 ? bodyBytes * count / all : 0,
                           .isAnswered = isAnswered});
}

void Outbox::takeNews(const Inbox& inbox) {
  const MonotonicTime now = ports_.clock.monotonic();
  for (const std::string& server : inbox.answering)
    if (ServerLine* line = posts_.line(server)) {
      line->isPrompt = true;
      hearGood(*line);
    }
  if (!inbox.connectivityChanged && !inbox.flush) return;
  for (auto& [server, line] : posts_.lines()) {
    if (inbox.flush) {
      line.nextTry = now;
      line.notBefore = MonotonicTime();
      KeptPosts::comeBack(line, true);
    } else if (line.isUnreachable) {
      hasten(line, kBetweenTries);
    }
  }
}

}  // namespace kyt
