// The spool's file: what is added, removed and read.
#include <algorithm>
#include <utility>

#include "receiver/Limits.h"
#include "receiver/Spool.h"

namespace kyt::receiver {
namespace {

StoredPost storedPostOf(const LogMessage& message, int64_t number, int64_t now) {
  StoredPost post;
  post.number = number;
  post.keptAt = now;
  post.url = message.id;
  post.headers = message.headers;
  post.body = Data(std::string_view(message.body));
  return post;
}

}  // namespace

void Spool::open() {
  const auto wrong = problemOfOpening();
  isOpen_ = !wrong;
  if (wrong) {
    forgetAll();
    count(figures_.spoolFailures);
    nextOpening_ = clock_.monotonic() + Limits::reopenPause;
    if (!isBroken_.exchange(true))
      lines_.error("spool: %s; posts that the log does not take are refused", wrong->c_str());
    return showFigures();
  }
  if (isBroken_.exchange(false)) lines_.normal("spool: it can be written to again");
  if (!entries_.empty())
    lines_.normal("spool: %zu posts of %llu bytes are left from before", entries_.size(),
                  static_cast<unsigned long long>(bytes_.load()));
  showFigures();
}

// What is kept in a file that has no name any more ends with this process, so nothing is added to it.
void Spool::lookForFolder() {
  if (!isOpen_ || !isOurs_ || isOurs_()) return;
  if (!std::exchange(isLost_, true)) {
    count(figures_.spoolFailures);
    isBroken_ = true;
    lines_.error(
        "spool: its folder was removed or replaced; %zu posts of it are lost if this process ends before the log "
        "has them, and until then posts that the log does not take are refused",
        entries_.size());
  }
  failedAt_ = clock_.monotonic();
  if (!entries_.empty()) return;
  store_.close();
  forgetAll();
  isOpen_ = isLost_ = false;
  nextOpening_ = {};
}

std::optional<std::string> Spool::problemOfOpening() {
  if (prepare_)
    if (auto wrong = prepare_()) return wrong;
  for (bool again : {true, false}) {
    const auto wrong = store_.open([this](StoredPostHead head) {
      if (head.isUnreadable) return count(figures_.stuck);
      enter(head.post.number, {head.bytes, head.post.keptAt, partitionOf(head.post.url, partitions())});
      lastNumber_ = std::max(lastNumber_, head.post.number);
      bytes_ += head.bytes;
    });
    if (!wrong) break;
    if (wrong->kind != PostStoreProblem::Kind::damaged || !again) return wrong->text;
    setAside(wrong->text);
  }
  return std::nullopt;
}

void Spool::enter(int64_t number, Entry entry) {
  lanes_[entry.partition].waiting.insert(number);
  entries_[number] = entry;
}

void Spool::setStuck(int64_t number) {
  const auto known = entries_.find(number);
  ++stuckPosts_;
  stuckBytes_ += known->second.bytes;
  lanes_[known->second.partition].waiting.erase(number);
  entries_.erase(known);
  count(figures_.stuck);
}

void Spool::setAside(const std::string& why) {
  count(figures_.spoolFailures);
  const size_t posts = entries_.size() + stuckPosts_;
  forgetAll();
  const std::string what = posts == 0 ? "what was in it" : "its " + std::to_string(posts) + " posts";
  lines_.error("spool: %s; %s; %s devices think delivered: see A DAMAGED SPOOL in kytreceiver(8)",
               why.c_str(), store_.setAside().c_str(), what.c_str());
}

void Spool::forgetAll() {
  for (const auto& [number, entry] : entries_) bytes_ -= entry.bytes;
  bytes_ -= std::exchange(stuckBytes_, 0);
  stuckPosts_ = 0;
  entries_.clear();
  toRemove_.clear();
  inFlight_ = inFlightBytes_ = 0;
  for (Lane& lane : lanes_) {
    lane.waiting.clear();
    lane.inFlight = lane.inFlightBytes = 0;
  }
}

// One change of the file: what was added, what the log has. False: nothing of it was done.
bool Spool::change(const Additions& added) {
  if (!isOpen_) return added.empty();
  if (isLost_) {
    // Where the folder was moved, the file is still somebody's.
    if (!toRemove_.empty()) static_cast<void>(store_.change({}, toRemove_, false));
    forget(std::exchange(toRemove_, {}));
    return added.empty();
  }
  if (added.empty() && toRemove_.empty()) return true;
  const int64_t now = clock_.timeOfDay().seconds;
  std::vector<StoredPost> posts;
  std::vector<const StoredPost*> pointers;
  posts.reserve(added.size());
  for (const auto& adding : added)
    posts.push_back(
        storedPostOf(*adding->message, lastNumber_ + 1 + static_cast<int64_t>(posts.size()), now));
  pointers.reserve(posts.size());
  for (const StoredPost& post : posts) pointers.push_back(&post);
  const auto wrong = store_.change(pointers, toRemove_, false);
  if (wrong) {
    failedAt_ = clock_.monotonic();
    const bool isNew = !isBroken_.exchange(true);
    if (wrong->kind == PostStoreProblem::Kind::damaged) {
      setAside(wrong->text);
    } else {
      count(figures_.spoolFailures);
      if (isNew) lines_.error("spool: %s", wrong->text.c_str());
    }
    return false;
  }
  if (isBroken_.exchange(false)) lines_.normal("spool: it can be written to again");
  for (const auto& adding : added)
    enter(++lastNumber_, {adding->bytes, now, partitionOf(adding->message->id, partitions())});
  forget(std::exchange(toRemove_, {}));
  return true;
}

void Spool::forget(const std::vector<int64_t>& removed) {
  for (const int64_t number : removed) {
    const auto known = entries_.find(number);
    if (known == entries_.end()) continue;
    bytes_ -= known->second.bytes;
    entries_.erase(known);
  }
}

// None: that one is stuck, or the disk gives it another time. Either way those behind it go on.
std::shared_ptr<const LogMessage> Spool::read(int64_t number, Lane& lane) {
  auto read = store_.read(number);
  const auto* wrong = std::get_if<PostStoreProblem>(&read);
  lane.isUnread = wrong != nullptr && wrong->kind == PostStoreProblem::Kind::unavailable;
  if (wrong != nullptr) {
    count(figures_.spoolFailures);
    if (!std::exchange(entries_.at(number).isFailureTold, true))
      lines_.error("spool: %s", wrong->text.c_str());
    if (lane.isUnread)
      fail(lane);
    else
      setStuck(number);
    return nullptr;
  }
  auto& post = std::get<StoredPost>(read);
  auto message = std::make_shared<LogMessage>();
  message->id = std::move(post.url);
  message->headers = std::move(post.headers);
  message->body = std::string(post.body.view());
  return message;
}

}  // namespace kyt::receiver
