#include "outbox/KeptPosts.h"

#include <algorithm>

#include "platform/URLSession.h"

namespace kyt {
namespace {

auto fromNumber(std::deque<KeptPosts::Entry>& entries, int64_t number) {
  return std::lower_bound(
      entries.begin(), entries.end(), number,
      [](const KeptPosts::Entry& entry, int64_t wanted) { return entry.number < wanted; });
}

// The first from that number on that is there, not in flight and wanted; `from` goes along, so that no entry is passed
// twice.
template <typename Wanted>
KeptPosts::Entry* firstFrom(std::deque<KeptPosts::Entry>& entries, int64_t& from, Wanted wanted) {
  for (auto entry = fromNumber(entries, from); entry != entries.end(); ++entry) {
    if (entry->isGone || entry->isInFlight || !wanted(*entry)) continue;
    from = entry->number;
    return &*entry;
  }
  if (!entries.empty()) from = entries.back().number + 1;
  return nullptr;
}

}  // namespace

void KeptPosts::count(Entry& entry) {
  ++size_;
  bytes_ += entry.bytes;
  from_ = std::min(from_, entry.number);
  byConsent_ += entry.isByConsent ? 1 : 0;
  User& user = users_[entry.user];
  ++user.posts;
  user.bytes += entry.bytes;
  user.from = std::min(user.from, entry.number);
  ++entry.line->posts;
  entry.line->bytes += entry.bytes;
  entry.line->from = std::min(entry.line->from, entry.number);
}

KeptPosts::Entry& KeptPosts::add(int64_t number, const std::string& server, uint64_t bytes, uint32_t user,
                                 bool isByConsent, int64_t born) {
  ServerLine& line = lines_[server];
  if (line.server.empty()) line.server = server;
  Entry& entry = entries_.emplace_back();
  entry.number = number;
  entry.line = &line;
  entry.born = born;
  entry.bytes = static_cast<uint32_t>(bytes);
  entry.user = user;
  entry.isByConsent = isByConsent;
  count(entry);
  return entry;
}

KeptPosts::Entry* KeptPosts::find(int64_t number) {
  const auto found = fromNumber(entries_, number);
  return found != entries_.end() && found->number == number && !found->isGone ? &*found : nullptr;
}

KeptPosts::Entry* KeptPosts::oldestOf(ServerLine& line) {
  return firstFrom(entries_, line.from,
                   [&line](const Entry& entry) { return entry.line == &line && !entry.isAside; });
}

KeptPosts::Entry* KeptPosts::dueAside(ServerLine& line, MonotonicTime now, const Entry* before) {
  for (const auto& [number, aside] : line.aside) {
    if (before != nullptr && before->number < number) break;
    if (aside.waitsAlone() ? now < aside.notBefore : aside.wasTried) continue;
    if (Entry* entry = find(number); entry != nullptr && !entry->isInFlight) return entry;
  }
  return nullptr;
}

KeptPosts::Entry* KeptPosts::next(ServerLine& line, MonotonicTime now) {
  Entry* oldest = oldestOf(line);
  if (Entry* aside = dueAside(line, now, oldest)) return aside;
  if (oldest != nullptr || line.inFlight != 0) return oldest;
  comeBack(line);  // all were tried
  return dueAside(line, now, nullptr);
}

std::optional<MonotonicTime> KeptPosts::whenDue(const ServerLine& line) {
  std::optional<MonotonicTime> soonest;
  if (line.posts > line.aside.size()) return soonest;
  for (const auto& [number, aside] : line.aside) {
    if (!aside.waitsAlone()) return std::nullopt;
    soonest = std::min(soonest.value_or(aside.notBefore), aside.notBefore);
  }
  return soonest;
}

// A post that failed once may have met a server that fails. One that fails again, after the server took another, is the
// reason itself.
ServerLine::Aside* KeptPosts::standAsideOrStrike(Entry& entry) {
  ServerLine& line = *entry.line;
  const auto known = line.aside.find(entry.number);
  if (known != line.aside.end()) {
    if (known->second.strikes != 0 || line.failures == 0) return &known->second;
    known->second.wasTried = true;
    return nullptr;
  }
  if (line.aside.size() >= kMostAside) {
    comeBack(line);
    return nullptr;
  }
  line.aside[entry.number] = {};
  entry.isAside = true;
  return nullptr;
}

ServerLine::Aside& KeptPosts::setUnread(Entry& entry) {
  entry.isAside = true;
  return entry.line->aside[entry.number];
}

void KeptPosts::delay(Entry& entry, MonotonicTime until) {
  const auto known = entry.line->aside.find(entry.number);
  if (known == entry.line->aside.end() || !known->second.waitsAlone()) return;
  known->second.notBefore = std::max(known->second.notBefore, until);
}

void KeptPosts::comeBack(ServerLine& line, bool all) {
  for (auto& [number, aside] : line.aside) {
    aside.wasTried = false;
    if (all) aside.notBefore = MonotonicTime();
  }
}

KeptPosts::Entry* KeptPosts::oldestOfUser(uint32_t user) {
  const auto known = users_.find(user);
  if (known == users_.end()) return nullptr;
  return firstFrom(entries_, known->second.from, [user](const Entry& entry) { return entry.user == user; });
}

KeptPosts::Entry* KeptPosts::oldest() {
  return firstFrom(entries_, from_, [](const Entry&) { return true; });
}

void KeptPosts::setInFlight(Entry& entry, bool isInFlight) {
  entry.isInFlight = isInFlight;
  if (isInFlight) return;
  from_ = std::min(from_, entry.number);
  entry.line->from = std::min(entry.line->from, entry.number);
  User& user = users_[entry.user];
  user.from = std::min(user.from, entry.number);
}

void KeptPosts::remove(Entry& entry) {
  entry.isGone = true;
  if (entry.isAside) entry.line->aside.erase(entry.number);
  entry.isAside = false;
  --size_;
  bytes_ -= entry.bytes;
  byConsent_ -= entry.isByConsent ? 1 : 0;
  entry.line->bytes -= entry.bytes;
  --entry.line->posts;
  const auto user = users_.find(entry.user);
  user->second.bytes -= entry.bytes;
  if (--user->second.posts == 0) users_.erase(user);
}

void KeptPosts::putBack(int64_t number) {
  const auto found = fromNumber(entries_, number);
  if (found == entries_.end() || found->number != number || !found->isGone) return;
  found->isGone = false;
  count(*found);
}

void KeptPosts::removeNewest() {
  if (!entries_.back().isGone) remove(entries_.back());
  entries_.pop_back();
}

void KeptPosts::forgetGone() {
  while (!entries_.empty() && entries_.front().isGone) entries_.pop_front();
  // In the middle few are gone, but for a user's or a server's that were dropped.
  if (entries_.size() > 2 * size_ + 1024)
    std::erase_if(entries_, [](const Entry& entry) { return entry.isGone; });
  std::erase_if(lines_, [](const auto& line) { return line.second.posts == 0 && line.second.inFlight == 0; });
}

void KeptPosts::clear() {
  for (Entry& entry : entries_)
    if (!entry.isGone) remove(entry);
  entries_.clear();
}

uint64_t KeptPosts::bytesOfUser(uint32_t user) const {
  const auto known = users_.find(user);
  return known != users_.end() ? known->second.bytes : 0;
}

size_t KeptPosts::postsOfUser(uint32_t user) const {
  const auto known = users_.find(user);
  return known != users_.end() ? known->second.posts : 0;
}

std::vector<uint32_t> KeptPosts::users() const {
  std::vector<uint32_t> users;
  for (const auto& [user, share] : users_) users.push_back(user);
  return users;
}

ServerLine* KeptPosts::line(const std::string& server) {
  const auto known = lines_.find(server);
  return known != lines_.end() ? &known->second : nullptr;
}

}  // namespace kyt
