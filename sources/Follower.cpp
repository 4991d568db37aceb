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
  if (const auto state = readState(options_.stateFile)) state_ = *state;
  if (!state_.position.starts_with("@") && journal_.goAfter(state_.position)) {
    const auto place = placeOf(state_.position);
    const auto oldest = journal_.oldest();
    if (place && oldest && *oldest > place->microseconds) unreadFrom_ = place;
    return;
  }
  uint64_t time = 0;
  const std::string& text = state_.position;
  if (text.size() > 1 &&
      std::from_chars(text.data() + 1, text.data() + text.size(), time).ec == std::errc()) {
    journal_.goToTime(time);
    return;
  }
  goToThePresent();
  writeDown();
}

void Follower::goToThePresent() {
  const uint64_t now = now_();
  journal_.goToTime(now);
  state_.position = "@" + std::to_string(now);
}

void Follower::look() {
  const auto end = processorTime() + options_.lookBudget;
  const bool wasBehind = std::exchange(behind_, false);
  bool found = false;
  for (int count = 1; journal_.next(); ++count) {
    if (wasBehind && count == 1 &&
        journal_.microseconds() + static_cast<uint64_t>(options_.mostBehind.count()) * kMicroseconds <
            now_()) {
      unreadFrom_ = placeOf(journal_.cursor());
      goToThePresent();
      return;
    }
    found = true;
    take();
    if (count % kEntriesBetweenClocks == 0 && processorTime() > end) {
      behind_ = true;
      break;
    }
  }
  if (!found) return;
  if (std::string cursor = journal_.cursor(); !cursor.empty()) state_.position = std::move(cursor);
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
  if (!summary_.empty()) {
    const std::vector<SourceEvent> events = summary_.events(state_.report);
    summary_.forget(deliver_(events));
    if (!summary_.empty()) {
      summary_.addWait();
      return false;
    }
    ++state_.report;
  }
  writeDown();
  return true;
}

void Follower::writeDown() {
  stateProblem_ = writeState(options_.stateFile, state_).value_or(std::string());
}

}  // namespace kyt::sources
