// What the fake daemon was told, and who waits for it. Any thread.
#pragma once

#include <chrono>
#include <vector>

#include "kytreporting/FakeDaemon.h"
#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"

namespace kyt::testing {

class Records {
 public:
  Records(Function<void(const Event&)> told, uint64_t dieAfter)
      : told_(std::move(told)), dieAfter_(dieAfter) {}

  // False, and it is not kept, where the daemon is dead.
  bool add(Event event) EXCLUDES(mutex_, telling_);
  // It lives again: counts messages from the beginning.
  void begin() EXCLUDES(mutex_);
  // What a dead daemon owes its clients, until they are gone.
  void keepAnswer(Task answer) EXCLUDES(mutex_);
  void dropAnswers() EXCLUDES(mutex_);
  // It ends: waitForDeath() returns.
  void end() EXCLUDES(mutex_);
  // Whether it died; false: it was ended.
  [[nodiscard]] bool waitForDeath() EXCLUDES(mutex_);
  [[nodiscard]] bool isAlive() const EXCLUDES(mutex_);
  [[nodiscard]] std::vector<Event> events(std::optional<Kind> kind) const EXCLUDES(mutex_);
  [[nodiscard]] bool waitFor(Kind kind, size_t count, std::chrono::milliseconds timeout) const
      EXCLUDES(mutex_);

 private:
  [[nodiscard]] size_t count(Kind kind) const REQUIRES(mutex_);

  mutable Mutex mutex_;
  mutable ConditionVariable changed_;
  Mutex telling_;  // nothing else is locked meanwhile
  Function<void(const Event&)> told_ GUARDED_BY(telling_);
  const uint64_t dieAfter_;
  std::vector<Event> events_ GUARDED_BY(mutex_);
  std::vector<Task> answers_ GUARDED_BY(mutex_);
  uint64_t messages_ GUARDED_BY(mutex_) = 0;  // of this life
  bool alive_ GUARDED_BY(mutex_) = false, dead_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt::testing
