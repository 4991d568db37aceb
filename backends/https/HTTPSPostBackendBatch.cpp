// How HTTPSPostBackend batches and flushes. What touches the batch runs on the state queue; messages are built and
// completions run after it has been left.
#include <optional>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/objects/Keys.h"
#include "platform/objects/ObjectSize.h"
#include "platform/queues/LargeWork.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/LineOrder.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

// Bytes of a batch, or of the message made of it, that take some ten milliseconds to write and compress: large work. Below, a
// worker more would cost more than it gives.
constexpr size_t kTakesLong = 256u << 10;

Error localError(const char* text) {
  return Error{kKYTReportingErrorDomain, -1, text};
}

void complete(FlushCompletion& completion, Error error) {
  if (completion) completion(Value(), std::move(error));
}

}  // namespace

EventKind HTTPSPostBackend::kindOf(const Dictionary& record) {
  const auto number = [&record](const char* key) {
    const Value* value = record.find(key);
    return value != nullptr ? static_cast<int32_t>(value->unsignedIntValue() & 0xffffU) : -1;
  };
  return {number("_method"), number("_status")};
}

void HTTPSPostBackend::showFate(BookedEvents& events, const Array& records,
                                std::optional<Reason> dropped) const {
  const std::shared_ptr<Watchers>& watchers = platform().books.watchers();
  if (!watchers->anybody()) return;
  BookedEvents::Shown shown{watchers, name().str(), "", {}, nullptr};
  if (dropped)
    shown.rule = ruleFor(*dropped, {});
  else
    shown.post = std::make_shared<WatchedPost>(watchers);
  shown.kinds.reserve(records.size());
  for (const Value& record : records)
    shown.kinds.push_back(record.dictionary() != nullptr ? kindOf(*record.dictionary()) : EventKind());
  events.show(std::move(shown));
}

Value HTTPSPostBackend::batchEvent(Dictionary record) {
  const int32_t method = record.integer("_method");
  uint64_t batched = 0;
  int32_t count = stateQueue().sync([&] {
    stateQueue().assertCurrent();
    batch_.begin();
    batched = batch_.bytes();
    return batch_.count(method);
  });
  Value flushed;
  if (count > decision_.eventThreshold) {
    platform().log.debug(
        "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method %d",
        method);
    flushed = flushMessagesWithCompletion(nullptr);
    count = 0;
    batched = stateQueue().sync([this] {
      stateQueue().assertCurrent();
      return batch_.bytes();  // a flush may have kept the batch
    });
  }
  const uint64_t bytes = roughSize(record);
  if (!takesRoomFor(batched, bytes)) {
    // What was dropped must not leave an empty batch behind: a flush would say that it was filtered out.
    stateQueue().async([this] {
      stateQueue().assertCurrent();
      batch_.endIfEmpty();
    });
    return flushed;
  }
  stateQueue().async([this, record = std::move(record), method, count, bytes, booked = tally()]() mutable {
    stateQueue().assertCurrent();
    batch_.append(std::move(record), method, count + 1, bytes, combinedSessionIDOnQueue(), booked);
    standing()->setBatch(batch_.size(), batch_.bytes());
  });
  return flushed;
}

// Takes it from the user's account too; an event without room is dropped.
bool HTTPSPostBackend::takesRoomFor(uint64_t batched, uint64_t bytes) {
  if (batched + bytes > platform().limits.maxBatchBytes) {
    dropEvent(Reason::batchFull);
    tellDroppedByLimit();
    return false;
  }
  if (userAccount() == nullptr || userAccount()->take(Share::bytes, bytes, kLeftForMessages)) return true;
  dropEvent(Reason::userBatchesFull);
  tellDroppedByUser();
  return false;
}

void HTTPSPostBackend::giveBackToUser(uint64_t bytes) const {
  if (userAccount() != nullptr) userAccount()->giveBack(Share::bytes, bytes);
}

void HTTPSPostBackend::tellDroppedByLimit() const {
  if (!platform().counters.addAndMayLog(Reason::batchFull, platform().clock.monotonic(), 0)) return;
  platform().log.error(
      "HTTPSPostBackend(batchEvent): the batch of backend %s is full (%llu bytes), dropping events",
      name().c_str(), static_cast<unsigned long long>(platform().limits.maxBatchBytes));
}

void HTTPSPostBackend::tellDroppedByUser() const {
  if (!platform().counters.addAndMayLog(Reason::userBatchesFull, platform().clock.monotonic(), 0)) return;
  platform().log.error(
      "HTTPSPostBackend(batchEvent): user %u holds %llu bytes, dropping events of backend %s",
      userAccount()->user(), static_cast<unsigned long long>(userAccount()->holds(Share::bytes)),
      name().c_str());
}

HTTPSPostBackend::BatchTaking HTTPSPostBackend::takeBatchOnQueue(EventBatch::Taken& batch) {
  if (!batch_.exists()) return BatchTaking::nothing;
  const bool enabled = stateOnQueue() == kBackendStateEnabled;
  if (enabled && lacksUserInfo()) return BatchTaking::userInfoMissing;
  batch = batch_.take(combinedSessionIDOnQueue());
  standing()->setBatch(0, 0);
  return enabled ? BatchTaking::taken : BatchTaking::discarded;
}

void HTTPSPostBackend::tellDiscarded(size_t events, const char* why) const {
  if (!platform().counters.mayTell(Reason::batchDiscarded, why + std::to_string(facts().compType),
                                   platform().clock.monotonic()))
    return;
  platform().log.normal("HTTPSPostBackend(flushMessages): %s discards %zu events of client type %d: %s",
                        name().c_str(), events, facts().compType, why);
}

Value HTTPSPostBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  return flush(std::move(completion), TextOf::flush);
}

Value HTTPSPostBackend::flush(FlushCompletion completion, TextOf text) {
  EventBatch::Taken batch;
  const BatchTaking taking = stateQueue().sync([&] {
    stateQueue().assertCurrent();
    return takeBatchOnQueue(batch);
  });
  switch (taking) {
    case BatchTaking::discarded:
      giveBackToUser(batch.bytes);
      showFate(batch.events, batch.records, Reason::batchDiscarded);
      batch.events.drop(platform().counters, Reason::batchDiscarded);
      if (lacksUserInfo())
        tellDiscarded(batch.records.size(), "user information was promised and is missing");
      [[fallthrough]];
    case BatchTaking::nothing:
      complete(completion, localError("Nothing to flush"));
      return {};
    case BatchTaking::userInfoMissing:
      complete(completion, localError("Can not flush: userInfo is required"));
      return {};
    case BatchTaking::taken:
      break;
  }
  platform().log.debug("HTTPSPostBackend(flushMessagesWithCompletion): called");
  const uint64_t bytes = batch.bytes;
  EventBatch::Taken kept = recordsToPost(std::move(batch));
  if (kept.records.empty()) {
    giveBackToUser(bytes);
    complete(completion, localError("Nothing to flush: batched events were completely filtered out"));
    return {};
  }
  return postBatch(std::move(kept), bytes, std::move(completion), text);
}

Value HTTPSPostBackend::postBatch(EventBatch::Taken batch, uint64_t bytes, FlushCompletion completion,
                                  TextOf text) {
  const PostRequest post(configuration_, postFacts());
  const bool mayBeShown = post.mayBeShown();
  const bool mayGoBeside =
      !completion && text == TextOf::flush && bytes >= PostLine::kLeastBytes && decision_.postURL;
  std::optional<LargeWork::Scope> large;
  // What is posted beside may need a place in that line itself.
  const auto beginLarge = [&] {
    line_.finish();
    large.emplace(platform().largeWork);
  };
  if (bytes >= kTakesLong && mayGoBeside) large.emplace(platform().largeWork);
  if (bytes >= kTakesLong && !mayGoBeside) beginLarge();
  showFate(batch.events, batch.records, std::nullopt);
  PostRequest::Message message = makeMessage(post, std::move(batch.records));
  Value pretty;
  if (mayBeShown && (text == TextOf::flushAndEvent || isAnswerWanted(message.prettySize)))
    pretty = PostRequest::prettyText(message.json);
  const bool goesBeside = mayGoBeside && pretty.isNull();
  if (mayGoBeside) large.reset();
  if (goesBeside) {
    postBeside(std::move(message), std::move(batch.events), bytes);
  } else {
    if (!large && message.json.size() >= kTakesLong) beginLarge();
    giveBackToUser(bytes);  // the request counts by itself
    FlushCompletion answer;
    if (completion)
      answer = [pretty, completion = std::move(completion)](const Value&,
                                                            std::optional<Error> error) mutable {
        completion(pretty, std::move(error));
      };
    postJSONMessage(std::move(message.json), MessageFlag{0}, std::nullopt, std::nullopt, std::move(answer),
                    carried(std::move(batch.events), message.events));
  }
  if (mayBeShown) immutable_ = true;
  return pretty;
}

// The records, of which the text alone is left, count with the user until the request does. The post's lines stand where it
// was decided on.
void HTTPSPostBackend::postBeside(PostRequest::Message message, BookedEvents events, uint64_t bytes) {
  std::optional<OutgoingPost> post =
      newPost(MessageFlag{0}, std::nullopt, std::nullopt, nullptr, std::move(events));
  if (!post) return giveBackToUser(bytes);
  line_.add(
      [post = std::move(*post), message = std::move(message), bytes, taken = LineOrder::later()]() mutable {
        const LineOrder::SharedPlace place = std::move(taken);
        const LineOrder::Scope lines(place);
        const std::shared_ptr<UserAccount> account = post.reply.account;
        const ClientScope scope(account ? std::optional(account->user()) : std::nullopt);
        std::optional<LargeWork::Scope> large;
        if (bytes >= kTakesLong || message.json.size() >= kTakesLong)
          large.emplace(post.reply.platform.largeWork);
        if (account != nullptr) account->giveBack(Share::bytes, bytes);
        if (message.events == 0) post.reply.events.dropped(Reason::postWithoutClientID);
        std::move(post).send(std::move(message.json));
      });
}

bool HTTPSPostBackend::admits(const Dictionary& record) const {
  const auto category = static_cast<uint16_t>(record.integer("_method"));
  if (!isWhitelistedEvent(category)) {
    platform().log.debug(
        "flushMessagesWithCompletion: Dropping event with category %d as it is not whitelisted for backend %s",
        category, name().c_str());
    return false;
  }
  if (isBlacklistedEvent(category)) {
    platform().log.debug(
        "flushMessagesWithCompletion: Dropping event with category %d as it is blacklisted for backend %s",
        category, name().c_str());
    return false;
  }
  return true;
}

// The records that the lists admit, each with the user information of now, filtered, over what it had. User information
// that came after the records makes every one of them larger, and must not make of a batch within its limit a message
// past all bounds: then the newest are dropped.
EventBatch::Taken HTTPSPostBackend::recordsToPost(EventBatch::Taken batch) const {
  Dictionary information;
  if (userInfo() != nullptr) information = *userInfo();
  filterEvent(information);
  const uint64_t limit = platform().limits.maxBatchBytes;
  const bool mayOutgrow = batch.bytes + batch.records.size() * roughSize(information) > limit;
  uint64_t bytes = 0;
  EventBatch::Taken kept;
  kept.records.reserve(batch.records.size());
  BookedEventsReader tallies(batch.events);
  Value* values = batch.records.mutableBegin();
  for (size_t i = 0; i < batch.records.size(); ++i) {
    Dictionary* record = values[i].mutableDictionary();
    Tally* tally = tallies.next();
    if (!admits(*record)) {
      dropEvent(tally, kindOf(*record), Reason::batchedEventFiltered);
      continue;
    }
    record->merge(information);
    if (mayOutgrow && (bytes += roughSize(*record)) > limit) {
      dropEvent(tally, kindOf(*record), Reason::batchFull);
      tellDroppedByLimit();
      continue;
    }
    kept.records.append(std::move(values[i]));
    kept.events.add(tally);
  }
  return kept;
}

void HTTPSPostBackend::setCorrelatedSessionID(const SessionIDPath& sessionID) {
  stateQueue().sync([&] {
    stateQueue().assertCurrent();
    setCombinedSessionIDOnQueue(sessionID);
    batch_.sessionIDChanged();
  });
}

uint64_t HTTPSPostBackend::batchedEventsSize() {
  return stateQueue().sync([this] {
    stateQueue().assertCurrent();
    return batch_.sizeEstimate(combinedSessionIDOnQueue(), platform().memory);
  });
}

}  // namespace kyt
