#include "testing/Records.h"

#include <algorithm>
#include <utility>

namespace kyt::testing {

bool Records::add(Event event) {
  {
    MutexLock lock(mutex_);
    if (!alive_) return false;
    events_.push_back(event);
    if (event.kind == Kind::message && ++messages_ == dieAfter_) {
      alive_ = false;
      dead_ = true;
    }
    changed_.notifyAll();
  }
  MutexLock lock(telling_);
  if (told_) told_(event);
  return true;
}

void Records::begin() {
  MutexLock lock(mutex_);
  messages_ = 0;
  alive_ = true;
  dead_ = false;
}

void Records::keepAnswer(Task answer) {
  MutexLock lock(mutex_);
  answers_.push_back(std::move(answer));
}

void Records::dropAnswers() {
  std::vector<Task> answers;
  MutexLock lock(mutex_);
  answers.swap(answers_);  // they go after the lock
}

void Records::end() {
  MutexLock lock(mutex_);
  alive_ = false;
  changed_.notifyAll();
}

bool Records::waitForDeath() {
  MutexLock lock(mutex_);
  while (alive_) changed_.wait(mutex_);
  return dead_;
}

bool Records::isAlive() const {
  MutexLock lock(mutex_);
  return alive_;
}

std::vector<Event> Records::events(std::optional<Kind> kind) const {
  MutexLock lock(mutex_);
  std::vector<Event> found;
  for (const Event& event : events_)
    if (!kind || event.kind == *kind) found.push_back(event);
  return found;
}

size_t Records::count(Kind kind) const {
  return static_cast<size_t>(std::count_if(events_.begin(), events_.end(),
                                           [kind](const Event& event) { return event.kind == kind; }));
}

bool Records::waitFor(Kind kind, size_t wanted, std::chrono::milliseconds timeout) const {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  MutexLock lock(mutex_);
  while (count(kind) < wanted)
    if (!changed_.waitUntil(mutex_, deadline)) return count(kind) >= wanted;
  return true;
}

}  // namespace kyt::testing
