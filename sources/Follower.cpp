#include "sources/Follower.h"

#include <time.h>

#include <charconv>
#include <utility>

namespace kyt::sources {

namespace {

constexpr uint64_t kMicroseconds = 1'000'000;
constexpr int kEntriesBetweenClocks = 16;

std::chrono::microseconds processorTime() {
  timespec time = {};
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
  return std::chrono::seconds(time.tv_sec) + std::chrono::microseconds(time.tv_nsec / 1000);
}

// "@" and microseconds.
std::optional<uint64_t> timeIn(const std::string& position) {
  uint64_t time = 0;
  const bool isTime =
      position.starts_with("@") &&
      std::from_chars(position.data() + 1, position.data() + position.size(), time).ec == std::errc();
  return isTime ? std::optional(time) : std::nullopt;
}

}  // namespace

Follower::Follower(Journal& journal, Options options, Finder finder, Deliver deliver,
                   std::function<uint64_t()> now)
    : journal_(journal),
      options_(std::move(options)),
      finder_(std::move(finder)),
      deliver_(std::move(deliver)),
      now_(std::move(now)),
      summary_(options_.category) {
  begin();
}

void Follower::begin() {
  const auto now = std::chrono::microseconds(now_());
  state_ = stateAtStart(options_.stateFile, std::chrono::floor<std::chrono::seconds>(now), startProblem_);
  if (goToPosition()) {
    read_ = state_.position;
    return;
  }
  goToThePresent();
  state_.position = read_;
  state_.until.clear();
  writeDown();
}

bool Follower::goToPosition() {
  if (!state_.position.starts_with("@") && journal_.goAfter(state_.position)) {
    const auto place = placeOf(state_.position);
    const auto oldest = journal_.oldest();
    if (place && oldest && *oldest > place->microseconds) unreadFrom_ = place;
    return true;
  }
  const auto time = timeIn(state_.position);
  if (time) journal_.goToTime(*time);
  return time.has_value();
}

void Follower::goToThePresent() {
  const uint64_t now = now_();
  journal_.goToTime(now);
  read_ = "@" + std::to_string(now);
}

bool Follower::isPastWhatWasBegun() const {
  if (const auto time = timeIn(state_.until)) return journal_.microseconds() >= *time;
  const auto last = placeOf(state_.until), place = placeOf(journal_.cursor());
  if (!last || !place) return true;
  return last->numbering == place->numbering ? place->number > last->number
                                             : place->microseconds > last->microseconds;
}

void Follower::closeWhatWasBegun() {
  begun_ = Begun{summary_.events(state_.report), state_.until};
  summary_.clear();
}

void Follower::look() {
  const auto end = processorTime() + options_.lookBudget;
  const bool wasBehind = std::exchange(behind_, false);
  bool found = false;
  for (int count = 1; journal_.next(); ++count) {
    if (wasBehind && count == 1 &&
        journal_.microseconds() + static_cast<uint64_t>(options_.mostBehind.count()) * kMicroseconds <
            now_()) {
      if (isReadingAgain()) closeWhatWasBegun();
      unreadFrom_ = placeOf(journal_.cursor());
      goToThePresent();
      return;
    }
    found = true;
    if (isReadingAgain() && isPastWhatWasBegun()) closeWhatWasBegun();
    take();
    if (count % kEntriesBetweenClocks == 0 && processorTime() > end) {
      behind_ = true;
      break;
    }
  }
  if (isReadingAgain() && !behind_) closeWhatWasBegun();  // there is no more
  if (!found) return;
  if (std::string cursor = journal_.cursor(); !cursor.empty()) read_ = std::move(cursor);
}

void Follower::take() {
  if (unreadFrom_) {
    const auto place = placeOf(journal_.cursor());
    // Where the journal began a new numbering in between, only that there was something is known.
    const bool comparable =
        place && place->numbering == unreadFrom_->numbering && place->number > unreadFrom_->number;
    summary_.addUnread(comparable ? place->number - unreadFrom_->number : 1);
    unreadFrom_.reset();
  }
  const auto finding = finder_([this](const char* name) { return journal_.field(name); });
  if (finding) summary_.add(finding->type, finding->fields, journal_.microseconds());
}

bool Follower::report() {
  if (begun_ && !reportBegun()) return false;
  if (isReadingAgain()) return true;  // not all of what was begun is there yet
  if (summary_.empty()) {
    state_.position = read_;
    writeDown();
    return true;
  }
  std::vector<SourceEvent> events = summary_.events(state_.report);
  const Handover handover = deliver_(events);
  if (!handover.offered) {
    summary_.addWait();
    return false;
  }
  begun_ = Begun{std::move(events), read_};
  summary_.clear();
  return settle(handover.taken);
}

bool Follower::reportBegun() {
  if (begun_->events.empty()) return settle({});  // the journal was cleaned up meanwhile
  const Handover handover = deliver_(begun_->events);
  if (handover.offered) return settle(handover.taken);
  summary_.addWait();
  return false;
}

// Whether nothing of the report that was begun is left.
bool Follower::settle(const std::vector<bool>& taken) {
  std::vector<SourceEvent> left;
  for (size_t index = 0; index < begun_->events.size(); ++index)
    if (index >= taken.size() || !taken[index]) left.push_back(std::move(begun_->events[index]));
  begun_->events = std::move(left);
  const bool isWhole = begun_->events.empty();
  if (isWhole) {
    ++state_.report;
    state_.position = std::move(begun_->until);
    state_.until.clear();
    begun_.reset();
  } else {
    state_.until = begun_->until;
    summary_.addWait();
  }
  writeDown();
  return isWhole;
}

void Follower::writeDown() {
  stateProblem_ = writeState(options_.stateFile, state_).value_or(std::string());
}

}  // namespace kyt::sources
