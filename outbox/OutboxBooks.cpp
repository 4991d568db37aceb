#include "outbox/OutboxBooks.h"

#include <algorithm>

namespace kyt {

OutboxBooks::Held& OutboxBooks::held(const BookRowName& row) {
  Held& held = held_[row];
  if (!held.tally) held.tally = books_.reopen(row);
  return held;
}

void OutboxBooks::restore(const Events& events) {
  for (const auto& [row, count] : events) {
    Held& ofRow = held(row);
    ofRow.events += count;
    ofRow.tally->restore(count);
  }
}

void OutboxBooks::enter(const BookedEvents* booked, const Events& events) {
  if (booked != nullptr) booked->keep();
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

void OutboxBooks::deliver(const Events& events) {
  leave(events, [](Tally& tally, uint64_t count) { tally.deliver(count); });
}

void OutboxBooks::drop(const Events& events, Reason fate) {
  leave(events, [this, fate](Tally& tally, uint64_t count) {
    counters_.add(fate, count);
    tally.drop(fate, count);
  });
}

void OutboxBooks::dropRest(Reason fate) {
  Events rest;
  for (const auto& [row, held] : held_) rest.push_back({row, held.events});
  drop(rest, fate);
}

}  // namespace kyt
