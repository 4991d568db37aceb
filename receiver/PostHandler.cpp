#include "receiver/PostHandler.h"

#include <algorithm>
#include <utility>

#include "receiver/JSONCheck.h"
#include "receiver/Limits.h"

namespace kyt::receiver {
namespace {

using http::Answer;
using http::LaterReply;
using http::Reply;
using http::Request;
using http::textReply;

// Devices that keep their posts come back after so many seconds.
constexpr const char* kRetryAfter = "30";

// Whether it can be of use to see it: a wrong address or method is no post.
bool isDeadLetter(Refusal refusal) {
  switch (refusal) {
    case Refusal::unknownPath:
    case Refusal::wrongMethod:
    case Refusal::bodiesFull:
      return false;
    default:
      return true;
  }
}

}  // namespace

PostHandler::PostHandler(const Settings& settings, Options options, Delivery& delivery, EventLog& log,
                         DeadLetters& deadLetters, const Clock& clock, Figures& figures)
    : settings_(settings),
      options_(options),
      delivery_(delivery),
      log_(log),
      deadLetters_(deadLetters),
      clock_(clock),
      figures_(figures),
      check_(settings) {
  if (options.opensPosts) checks_.emplace(clock);
}

Reply PostHandler::refuse(Refusal refusal, const char* text) const {
  figures_.refuse(refusal);
  Reply reply = textReply(options_.refuseWith, std::string(text) + "\n");
  reply.headers.push_back({"Retry-After", kRetryAfter});
  return reply;
}

Reply PostHandler::reject(const Request& request, const Rejection& rejection) const {
  if (rejection.refusal == Refusal::bodiesFull) return refuse(rejection.refusal, rejection.text.c_str());
  figures_.refuse(rejection.refusal);
  if (isDeadLetter(rejection.refusal)) deadLetters_.send(request, rejection);
  Reply reply = textReply(rejection.status, rejection.text + "\n");
  if (rejection.refusal == Refusal::wrongMethod) reply.headers.push_back({"Allow", "POST"});
  return reply;
}

bool PostHandler::isRefused(const Request& request) const {
  return check_.rejectionByHeaders(request).has_value();
}

uint64_t PostHandler::bodyLimit(const Request& /*request*/) const {
  return std::min(settings_.maxBodyBytes, log_.maxBodyBytes().value_or(settings_.maxBodyBytes));
}

Reply PostHandler::replyFor(Fate fate, const LogMessage& message, bool hasDigest) const {
  switch (fate) {
    case Fate::stored:
    case Fate::spooled:
      count(fate == Fate::stored ? figures_.stored : figures_.spooled);
      count(figures_.bodyBytes, message.body.size());
      count(hasDigest ? figures_.digestsValid : figures_.digestsAbsent);
      return {};
    case Fate::spoolFull:
      return refuse(Refusal::spoolFull, "neither log nor spool has room");
    case Fate::spoolBroken:
      return refuse(Refusal::spoolBroken, "neither log nor spool can be written to");
    case Fate::tooLargeForLog:
      figures_.refuse(Refusal::tooLargeForLog);
      deadLetters_.send(message, Refusal::tooLargeForLog);
      return textReply(413, "the log takes no body of that size\n");
  }
  return {};
}

void PostHandler::deliver(Request& request, bool hasDigest, const std::shared_ptr<LaterReply>& later) {
  const TimeValue now = clock_.timeOfDay();
  auto message = std::make_shared<LogMessage>();
  message->id = messageID(request.body);
  message->headers = factsOf(request, message->id, now.seconds * 1000 + now.microseconds / 1000, hasDigest);
  message->body = std::move(request.body);
  delivery_.take(message, [this, later, message, hasDigest](Fate fate) {
    later->give(replyFor(fate, *message, hasDigest));
    --waiting_;
  });
}

// False: it has more than so many bytes, once it is opened.
bool PostHandler::open(Request& request, bool hasDigest, const std::shared_ptr<LaterReply>& later,
                       uint64_t mostBytes) {
  const PostLook look = lookAtPost(request.body, isGzip(request), mostBytes);
  if (look.hasMore) return false;
  if (!look.problem) {
    deliver(request, hasDigest, later);
    return true;
  }
  const Refusal refusal = look.problem->isGzip ? Refusal::notGzip : Refusal::notJSON;
  later->give(reject(request, {refusal, 400, look.problem->text}));
  --waiting_;
  return true;
}

void PostHandler::submit(Request& request, bool hasDigest, const std::shared_ptr<LaterReply>& later) {
  CheckThreads::Work work;
  work.bytes = request.body.size();
  work.look = [this, &request, hasDigest, later](uint64_t mostBytes) {
    return open(request, hasDigest, later, mostBytes);
  };
  work.refuse = [this, later] {
    later->give(refuse(Refusal::bodiesFull, "too many large posts wait to be opened"));
    --waiting_;
  };
  checks_->submit(std::move(work));
}

Answer PostHandler::answer(Request& request) {
  bool hasDigest = false;
  if (const auto rejection = check_.rejectionByHeaders(request)) return reject(request, *rejection);
  if (const auto rejection = check_.rejection(request, hasDigest)) return reject(request, *rejection);
  if (request.body.size() > Limits::surelyTakenBytes && !log_.maxBodyBytes())
    return refuse(Refusal::logLimitUnknown, "how large a body the log takes is not known yet");
  auto later = std::make_shared<LaterReply>();
  ++waiting_;  // first: whoever closes looks at it then
  if (isClosed_) {
    --waiting_;
    return refuse(Refusal::stopping, "this receiver is about to end");
  }
  // The request stays until the reply is given.
  if (checks_)
    submit(request, hasDigest, later);
  else
    deliver(request, hasDigest, later);
  return later;
}

void PostHandler::broken(Request& request) {
  figures_.refuse(request.tooSlow ? Refusal::tooSlow : Refusal::cutOff);
}

}  // namespace kyt::receiver
