#include "receiver/Delivery.h"

#include <utility>

#include "receiver/Limits.h"

namespace kyt::receiver {

Delivery::Delivery(EventLog& log, Spool& spool, const Clock& clock, Figures& figures, Log& lines,
                   Duration publishTime)
    : log_(log),
      spool_(spool),
      clock_(clock),
      figures_(figures),
      lines_(lines),
      publishTime_(publishTime),
      partitions_(spool.partitions()) {}

uint32_t Delivery::partitionOf(const LogMessage& message) const {
  return receiver::partitionOf(message.id, spool_.partitions());
}

uint64_t Delivery::enter(Pending pending) {
  pending.since = clock_.monotonic();
  MutexLock lock(mutex_);
  const uint64_t token = ++lastToken_;
  deadlines_.emplace_back(pending.since + publishTime_, token);
  pending_.emplace(token, std::move(pending));
  return token;
}

void Delivery::take(std::shared_ptr<const LogMessage> message, Done done) {
  if (!isUp_.load(std::memory_order_relaxed) ||
      !partitions_[partitionOf(*message)].isTrusted.load(std::memory_order_relaxed))
    return keep(std::move(message), std::move(done));
  const uint64_t token = enter({message, std::move(done)});
  log_.publish(token, std::move(message));
}

void Delivery::replay(int64_t number, std::shared_ptr<const LogMessage> message) {
  const uint64_t token = enter({message, {}, number});
  log_.publish(token, std::move(message));
}

uint64_t Delivery::pending() {
  MutexLock lock(mutex_);
  return pending_.size();
}

void Delivery::keep(std::shared_ptr<const LogMessage> message, Done done) {
  spool_.add(std::move(message), [done = std::move(done)](SpoolVerdict verdict) {
    switch (verdict) {
      case SpoolVerdict::kept:
        return done(Fate::spooled);
      case SpoolVerdict::full:
        return done(Fate::spoolFull);
      case SpoolVerdict::broken:
        return done(Fate::spoolBroken);
    }
  });
}

void Delivery::use(Partition& partition) {
  if (!partition.isUsed.load(std::memory_order_relaxed) && !partition.isUsed.exchange(true)) ++used_;
}

void Delivery::trust(uint32_t partition) {
  Partition& taking = partitions_[partition];
  use(taking);
  if (!taking.isTrusted.load(std::memory_order_relaxed)) taking.isTrusted = true;
  if (!taking.isFailing.load(std::memory_order_relaxed) || !taking.isFailing.exchange(false)) return;
  if (--failing_ != 0) return;
  isFullTold_ = false;
  lines_.normal("log: it takes messages again");
}

// Told of the first partition alone: a log that is in trouble has many.
void Delivery::distrust(uint32_t partition, const char* why) {
  Partition& failed = partitions_[partition];
  use(failed);
  {
    MutexLock lock(mutex_);
    if (failed.isTrusted.exchange(false)) failed.distrustedAt = clock_.monotonic();
  }
  if (failed.isFailing.exchange(true) || failing_++ != 0) return;
  lines_.error("log: %s; posts of partition %u go to the spool until it takes messages again", why,
               partition);
}

// Whatever else is wrong with it, that passes by itself only where posts leave the log with their age.
void Delivery::tellFull(const std::string& why) {
  if (isFullTold_.exchange(true)) return;
  lines_.error("log: it has no room: %s; posts go to the spool until older ones leave it or it gets more",
               why.c_str());
}

// At once, and then now and then: whoever posts what is too large may not fill the journal.
void Delivery::tellRefusedForGood(const std::string& why) {
  uint64_t messages = 0;
  {
    const MonotonicTime now = clock_.monotonic();
    MutexLock lock(mutex_);
    ++refusedSince_;
    if (refusalToldAt_ && now - *refusalToldAt_ < Limits::tellPause) return;
    refusalToldAt_ = now;
    messages = std::exchange(refusedSince_, 0);
  }
  lines_.error("log: messages that were refused for good: %llu, the last for %s",
               static_cast<unsigned long long>(messages), why.c_str());
}

void Delivery::refused(Pending pending) {
  if (pending.done)
    keep(std::move(pending.message), std::move(pending.done));
  else
    spool_.replayed(pending.number, SpoolReplay::failed);
}

void Delivery::answered(Pending pending, const LogAnswer& answer) {
  const bool isReplay = !pending.done;
  const uint32_t partition = partitionOf(*pending.message);
  switch (answer.verdict) {
    case LogVerdict::stored:
    case LogVerdict::duplicate:
      figures_.publishTime.add(clock_.monotonic() - pending.since);
      if (answer.verdict == LogVerdict::duplicate) count(figures_.duplicates);
      trust(partition);
      if (isReplay) return spool_.replayed(pending.number, SpoolReplay::stored);
      return pending.done(Fate::stored);
    case LogVerdict::refusedForGood:
      count(figures_.logRefusalsForGood);
      tellRefusedForGood(answer.text);
      trust(partition);
      if (isReplay) return spool_.replayed(pending.number, SpoolReplay::never);
      return pending.done(Fate::tooLargeForLog);
    case LogVerdict::full:
      count(figures_.logRefusalsFull);
      tellFull(answer.text);
      distrust(partition, answer.text.c_str());
      return refused(std::move(pending));
    case LogVerdict::refused:
      count(figures_.logRefusals);
      distrust(partition, answer.text.c_str());
      return refused(std::move(pending));
  }
}

void Delivery::logAnswered(uint64_t token, const LogAnswer& answer) {
  Pending pending;
  {
    MutexLock lock(mutex_);
    const auto known = pending_.find(token);
    if (known == pending_.end()) return;  // too late: the spool has it, and gives it to the log once more
    pending = std::move(known->second);
    pending_.erase(known);
  }
  answered(std::move(pending), answer);
}

void Delivery::partitionRefused(uint32_t partition, const std::string& why) {
  std::vector<Pending> lost;
  {
    MutexLock lock(mutex_);
    std::erase_if(pending_, [&](auto& entry) {
      const bool isOfIt = partitionOf(*entry.second.message) == partition;
      if (isOfIt) lost.push_back(std::move(entry.second));
      return isOfIt;
    });
  }
  if (lost.empty()) return;
  count(figures_.logRefusals, lost.size());
  distrust(partition, why.c_str());
  for (Pending& pending : lost) refused(std::move(pending));
}

void Delivery::logIsUp(bool isUp) {
  std::vector<Pending> lost;
  {
    MutexLock lock(mutex_);
    if (isUp_.exchange(isUp) == isUp) return;
    if (isUp) {
      wasUp_ = true;
    } else {
      lost.reserve(pending_.size());
      for (auto& [token, pending] : pending_) lost.push_back(std::move(pending));
      pending_.clear();
      deadlines_.clear();
    }
  }
  if (isUp)
    lines_.normal("log: it is there");
  else
    lines_.error("log: it is not there; posts go to the spool");
  for (Pending& pending : lost) refused(std::move(pending));
  if (isUp) {
    for (Partition& partition : partitions_) partition.isTrusted = true;
    spool_.wake();
  }
}

std::vector<Delivery::Pending> Delivery::takeLate(MonotonicTime now) {
  std::vector<Pending> late;
  MutexLock lock(mutex_);
  while (!deadlines_.empty() && deadlines_.front().first <= now) {
    if (auto known = pending_.find(deadlines_.front().second); known != pending_.end()) {
      late.push_back(std::move(known->second));
      pending_.erase(known);
    }
    deadlines_.pop_front();
  }
  // Where no post of the spool will show that the log takes messages again, the next of a device may.
  for (uint32_t i = 0; i < partitions_.size(); ++i) {
    Partition& partition = partitions_[i];
    if (partition.isTrusted || (spool_.hasReplays(i) && !spool_.isBroken())) continue;
    if (partition.distrustedAt + Limits::retryPause <= now) partition.isTrusted = true;
  }
  return late;
}

void Delivery::tick() {
  std::vector<Pending> late = takeLate(clock_.monotonic());
  if (late.empty()) return;
  count(figures_.logTimeouts, late.size());
  for (Pending& pending : late) {
    distrust(partitionOf(*pending.message), "a message was not acknowledged in time");
    refused(std::move(pending));
  }
}

}  // namespace kyt::receiver
