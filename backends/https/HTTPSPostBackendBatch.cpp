// The batch and its flush. What touches the batch runs on the state queue; messages are built and completions
// run after it has been left.
#include <algorithm>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/objects/Keys.h"
#include "platform/objects/ObjectSize.h"
#include "platform/queues/Log.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

namespace {

int32_t methodOf(const Dictionary& record) {
  const Value* method = record.find("_method");
  return method != nullptr ? method->intValue() : 0;
}

Error localError(const char* text) {
  return Error{kKYTReportingErrorDomain, -1, text};
}

void complete(FlushCompletion& completion, Error error) {
  if (completion) completion(Value(), std::move(error));
}

}  // namespace

int32_t HTTPSPostBackend::countOnQueue(int32_t method) const {
  const auto found = std::lower_bound(eventMethodCounts_.begin(), eventMethodCounts_.end(),
                                      std::pair<int32_t, int32_t>{method, 0});
  return found != eventMethodCounts_.end() && found->first == method ? found->second : 0;
}

void HTTPSPostBackend::appendOnQueue(Dictionary record, int32_t method, int32_t count, uint64_t bytes) {
  writeSessionIDOnQueue();  // the new record has its own
  if (!batchedEvents_) batchedEvents_.emplace();
  batchedEvents_->append(std::move(record));
  batchedBytes_ += bytes;
  const auto place = std::lower_bound(eventMethodCounts_.begin(), eventMethodCounts_.end(),
                                      std::pair<int32_t, int32_t>{method, 0});
  if (place != eventMethodCounts_.end() && place->first == method) {
    place->second = count;
  } else {
    eventMethodCounts_.insert(place, {method, count});
  }
}

Value HTTPSPostBackend::batchEvent(Dictionary record) {
  const int32_t method = methodOf(record);
  uint64_t batched = 0;
  int32_t count = stateQueue().sync([&] {
    if (!batchedEvents_) batchedEvents_.emplace();
    batched = batchedBytes_;
    return countOnQueue(method);
  });
  Value flushed;
  if (count > eventThreshold_) {
    platform().log.debug(
        "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method %d",
        method);
    flushed = flushMessagesWithCompletion(nullptr);
    count = 0;
    batched = stateQueue().sync([this] { return batchedBytes_; });  // a flush may have kept the batch
  }
  const uint64_t bytes = roughSize(record);
  const bool fits = batched + bytes <= platform().limits.maxBatchBytes;
  if (!fits || !takeFromUser(bytes)) {
    fits ? countDroppedByUser() : countDroppedByLimit();
    // What was dropped must not leave an empty batch behind: a flush would say that it was filtered out.
    stateQueue().async([this] {
      if (batchedEvents_ && batchedEvents_->empty()) batchedEvents_.reset();
    });
    return flushed;
  }
  stateQueue().async([this, record = std::move(record), method, count, bytes]() mutable {
    appendOnQueue(std::move(record), method, count + 1, bytes);
  });
  return flushed;
}

void HTTPSPostBackend::countDroppedByLimit() const {
  if (!platform().counters.addAndMayLog(Reason::batchFull, platform().clock.monotonic())) return;
  platform().log.error(
      "HTTPSPostBackend(batchEvent): the batch of backend %s is full (%llu bytes), dropping events",
      name().c_str(), static_cast<unsigned long long>(platform().limits.maxBatchBytes));
}

bool HTTPSPostBackend::takeFromUser(uint64_t bytes) const {
  return userAccount() == nullptr || userAccount()->take(Share::bytes, bytes, kLeftForMessages);
}

void HTTPSPostBackend::giveBackToUser(uint64_t bytes) const {
  if (userAccount() != nullptr) userAccount()->giveBack(Share::bytes, bytes);
}

void HTTPSPostBackend::countDroppedByUser() const {
  if (!platform().counters.addAndMayLog(Reason::userBatchesFull, platform().clock.monotonic())) return;
  platform().log.error(
      "HTTPSPostBackend(batchEvent): user %u holds %llu bytes, dropping events of backend %s",
      userAccount()->user(), static_cast<unsigned long long>(userAccount()->holds(Share::bytes)),
      name().c_str());
}

HTTPSPostBackend::BatchTaking HTTPSPostBackend::takeBatchOnQueue(Array& records, uint64_t& bytes) {
  if (!batchedEvents_) return BatchTaking::nothing;
  const bool enabled = stateOnQueue() == kBackendStateEnabled;
  if (enabled && facts().requireUserInfo && !hasUserInfo()) return BatchTaking::userInfoMissing;
  writeSessionIDOnQueue();
  records = std::move(*batchedEvents_);
  batchedEvents_.reset();
  eventMethodCounts_.clear();
  bytes = std::exchange(batchedBytes_, 0);
  forgetSizesOnQueue();
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
  Array batch;
  uint64_t bytes = 0;
  switch (stateQueue().sync([&] { return takeBatchOnQueue(batch, bytes); })) {
    case BatchTaking::discarded:
      giveBackToUser(bytes);
      platform().counters.add(Reason::batchDiscarded, batch.size());
      if (facts().requireUserInfo && !hasUserInfo())
        tellDiscarded(batch.size(), "user information was promised and is missing");
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
  Array records = recordsToPost(std::move(batch), bytes);
  Value pretty;
  std::optional<std::string> json;
  size_t events = 0;
  if (!records.empty()) json = createMessageForPostAndLogging(std::move(records), &pretty, &events);
  giveBackToUser(bytes);  // the request counts by itself
  if (!json) {
    complete(completion, localError("Nothing to flush: batched events were completely filtered out"));
    return {};
  }
  FlushCompletion answer;
  if (completion)
    answer = [pretty, completion = std::move(completion)](const Value&, std::optional<Error> error) mutable {
      completion(pretty, std::move(error));
    };
  postJSONMessage(std::move(*json), MessageFlag{0}, std::nullopt, std::nullopt, std::move(answer), events);
  if (!pretty.isNull()) immutable_ = true;
  return pretty;
}

bool HTTPSPostBackend::admits(const Dictionary& record) const {
  const auto category = static_cast<uint16_t>(methodOf(record));
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

// The records that the lists admit, each with the user information of now, filtered, over what it had.
// `bytes` is what the batch held. User information that came after the records makes every one of them
// larger, and must not make of a batch within its limit a message past all bounds: then the newest are
// dropped.
Array HTTPSPostBackend::recordsToPost(Array batch, uint64_t bytes) const {
  Dictionary userInfo;
  if (userInfoDict()) userInfo = *userInfoDict();
  filterEvent(userInfo);
  const uint64_t limit = platform().limits.maxBatchBytes;
  const bool mayOutgrow = bytes + batch.size() * roughSize(userInfo) > limit;
  uint64_t kept = 0;
  Array records;
  records.reserve(batch.size());
  Value* values = batch.mutableBegin();
  for (size_t i = 0; i < batch.size(); ++i) {
    Dictionary* record = values[i].mutableDictionary();
    if (!admits(*record)) {
      platform().counters.add(Reason::batchedEventFiltered);
      continue;
    }
    record->merge(userInfo);
    if (mayOutgrow && (kept += roughSize(*record)) > limit) {
      countDroppedByLimit();
      continue;
    }
    records.append(std::move(values[i]));
  }
  return records;
}

// Whoever joins a hierarchy changes the identifiers of all sessions beneath, and holds the agent's monitor
// meanwhile: the records wait until their own session takes or adds to them.
void HTTPSPostBackend::setCorrelatedSessionID(const SessionIDPath& sessionID) {
  stateQueue().sync([&] {
    setCombinedSessionIDOnQueue(sessionID);
    if (!batchedEvents_) return;
    forgetSizesOnQueue();
    batchHasOldSessionID_ = true;
  });
}

void HTTPSPostBackend::writeSessionIDOnQueue() {
  if (!std::exchange(batchHasOldSessionID_, false) || !batchedEvents_ || !combinedSessionIDOnQueue()) return;
  const Value sessionID(combinedSessionIDOnQueue()->text());
  Value* values = batchedEvents_->mutableBegin();
  for (size_t i = 0; i < batchedEvents_->size(); ++i)
    values[i].mutableDictionary()->set("_sessionID", sessionID);
}

// The ends of other sessions ask too, so records that were sized before are not sized again.
uint64_t HTTPSPostBackend::batchedEventsSize() {
  return stateQueue().sync([this] {
    writeSessionIDOnQueue();
    const size_t count = batchedEvents_ ? batchedEvents_->size() : 0;
    for (; sizedRecords_ < count; ++sizedRecords_)
      sizeOfRecords_ += objectSizeEstimate((*batchedEvents_)[sizedRecords_], platform().memory);
    return sizeOfRecords_;
  });
}

void HTTPSPostBackend::forgetSizesOnQueue() {
  sizedRecords_ = 0;
  sizeOfRecords_ = 0;
}

}  // namespace kyt
