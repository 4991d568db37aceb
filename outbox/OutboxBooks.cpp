#include "outbox/OutboxBooks.h"

#include <algorithm>

#include "platform/base/Limits.h"

namespace kyt {

OutboxBooks::Held& OutboxBooks::held(const BookRowName& row) {
  Held& held = held_[row];
  if (!held.tally) held.tally = books_.reopen(row);
  return held;
}

uint16_t OutboxBooks::remember(const Events& events) {
  if (const auto known = contents_.find(events); known != contents_.end()) return known->second;
  if (contents_.size() >= Limits::maxKnownOutboxContents) return 0;
  const auto number = static_cast<uint16_t>(contents_.size() + 1);
  contentsByNumber_.push_back(&contents_.emplace(events, number).first->first);
  return number;
}

const OutboxBooks::Events* OutboxBooks::remembered(uint16_t contents) const {
  return contents != 0 ? contentsByNumber_.at(contents - 1U) : nullptr;
}

void OutboxBooks::forgetContents() {
  contentsByNumber_.clear();
  contents_.clear();
}

void OutboxBooks::restore(const Events& events) {
  for (const auto& [row, count] : events) {
    Held& ofRow = held(row);
    ofRow.events += count;
    ofRow.tally->restore(count);
  }
}

void OutboxBooks::enter(int64_t post, const std::shared_ptr<const BookedEvents>& booked, const Events& events,
                        int status) {
  if (booked != nullptr) {
    booked->keep(status);
    if (booked->areShown() && watched_.size() < Limits::maxWatchedKeptPosts) watched_[post] = booked;
  }
  for (const auto& [row, count] : events) held(row).events += count;
}

template <typename Operation>
void OutboxBooks::leave(const Events& events, Operation operation) {
  for (const auto& [row, count] : events) {
    const auto known = held_.find(row);
    if (known == held_.end()) continue;
    const uint64_t leaving = std::min(count, known->second.events);
    known->second.tally->leaveOutbox(leaving);
    operation(*known->second.tally, leaving);
    known->second.events -= leaving;
    if (known->second.events == 0) held_.erase(known);
  }
}

void OutboxBooks::deliver(int64_t post, const Events& events, int status) {
  tellWatchers(post, events, std::nullopt, status);
  leave(events, [](Tally& tally, uint64_t count) { tally.deliver(count); });
}

void OutboxBooks::drop(int64_t post, const Events& events, Reason fate, int status) {
  tellWatchers(post, events, fate, status);
  leave(events, [this, fate](Tally& tally, uint64_t count) {
    counters_.add(fate, count);
    tally.drop(fate, count);
  });
}

void OutboxBooks::tellWatchers(int64_t post, const Events& events, std::optional<Reason> dropped,
                               int status) {
  if (!books_.watchers()->anybody()) return;
  if (const auto known = watched_.find(post); known != watched_.end()) {
    known->second->tellEnd(dropped, status);
    watched_.erase(known);
    return;
  }
  for (const auto& [row, count] : events) {
    const auto known = held_.find(row);
    if (known == held_.end()) continue;
    PassedEvent event = known->second.tally->passed(EventKind(), dropped);
    event.backEnd = row.backEnd;
    for (uint64_t left = std::min(count, known->second.events); left > 0; --left)
      if (books_.watchers()->want(event.program, event.kind)) books_.watchers()->tell(event);
  }
}

void OutboxBooks::forgetUnwatched() {
  if (!watched_.empty() && !books_.watchers()->anybody()) watched_.clear();
}

void OutboxBooks::dropRest(Reason fate) {
  Events rest;
  for (const auto& [row, held] : held_) rest.push_back({row, held.events});
  if (!rest.empty()) drop(0, rest, fate);
  watched_.clear();
}

}  // namespace kyt
