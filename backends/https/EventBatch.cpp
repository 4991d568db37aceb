#include "backends/https/EventBatch.h"

#include <algorithm>

#include "platform/objects/ObjectSize.h"

namespace kyt {

void EventBatch::begin() {
  if (!records_) records_.emplace();
}

void EventBatch::endIfEmpty() {
  if (records_ && records_->empty()) records_.reset();
}

int32_t EventBatch::count(int32_t method) const {
  const auto found = std::lower_bound(counts_.begin(), counts_.end(), std::pair<int32_t, int32_t>{method, 0});
  return found != counts_.end() && found->first == method ? found->second : 0;
}

void EventBatch::sessionIDChanged() {
  if (!records_) return;
  forgetSizes();
  hasOldSessionID_ = true;
}

void EventBatch::append(Dictionary record, int32_t method, int32_t count, uint64_t bytes,
                        const std::optional<SessionIDPath>& sessionID, Tally* tally) {
  writeSessionID(sessionID);  // the new record has its own
  begin();
  records_->append(std::move(record));
  events_.add(tally);
  if (tally != nullptr) tally->enterBatch();
  bytes_ += bytes;
  const auto place = std::lower_bound(counts_.begin(), counts_.end(), std::pair<int32_t, int32_t>{method, 0});
  if (place != counts_.end() && place->first == method) {
    place->second = count;
  } else {
    counts_.insert(place, {method, count});
  }
}

EventBatch::Taken EventBatch::take(const std::optional<SessionIDPath>& sessionID) {
  writeSessionID(sessionID);
  Taken taken;
  if (records_) taken.records = std::move(*records_);
  records_.reset();
  counts_.clear();
  taken.events = std::exchange(events_, {});
  taken.events.leaveBatch();
  taken.bytes = std::exchange(bytes_, 0);
  forgetSizes();
  return taken;
}

uint64_t EventBatch::sizeEstimate(const std::optional<SessionIDPath>& sessionID, MemoryInfo& memory) {
  writeSessionID(sessionID);
  for (; sizedRecords_ < size(); ++sizedRecords_)
    sizeOfRecords_ += objectSizeEstimate((*records_)[sizedRecords_], memory);
  return sizeOfRecords_;
}

void EventBatch::writeSessionID(const std::optional<SessionIDPath>& sessionID) {
  if (!std::exchange(hasOldSessionID_, false) || !records_ || !sessionID) return;
  const Value text(sessionID->text());
  Value* values = records_->mutableBegin();
  for (size_t i = 0; i < records_->size(); ++i) values[i].mutableDictionary()->set("_sessionID", text);
}

void EventBatch::forgetSizes() {
  sizedRecords_ = 0;
  sizeOfRecords_ = 0;
}

}  // namespace kyt
