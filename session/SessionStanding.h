// How the sessions stand, for whoever looks from outside: each publishes what it is when that changes (never for an event),
// and its back ends publish the rest (backend/BackEndStanding.h). So a reader waits for no session, however stuck, and none
// for a reader but while texts are copied.
//
// Any thread. The mutexes are leaves: nothing is called while one is held.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "backend/BackEndStanding.h"
#include "platform/base/Mutex.h"

namespace kyt {

// A session at one moment. Names are cut to Limits::maxBookNameBytes.
struct SessionView {
  uint32_t user = 0;
  int32_t process = 0;     // that connected; 0: not known
  std::string identifier;  // in the session's records
  int64_t since = 0;       // seconds since 1970
  uint32_t sessionID = 0;  // the client's
  int32_t clientType = 0;
  std::string clientName, service;
  std::string token;  // the beginning of the hierarchy's token: all of it would let its reader join
  uint32_t level = 0;
  std::string storebagVersion;
  std::vector<std::shared_ptr<const BackEndStanding>> backEnds;
};

class SessionStanding {
 public:
  explicit SessionStanding(SessionView first) : view_(std::move(first)) {}
  [[nodiscard]] SessionView view() const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    return view_;
  }
  // Changes the view by `change(SessionView&)`, which calls nothing that takes a lock.
  template <typename Change>
  void publish(Change change) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    change(view_);
  }

 private:
  mutable Mutex mutex_;
  SessionView view_ GUARDED_BY(mutex_);
};

// All sessions that live.
class SessionStandings {
 public:
  // Listed until the handle's last copy is gone.
  [[nodiscard]] std::shared_ptr<SessionStanding> add(SessionView first);
  // In the order of their beginnings, at most so many.
  [[nodiscard]] std::vector<SessionView> views(size_t most) const;
  // Calls `look(const SessionView&)` for each, one after the other.
  template <typename Look>
  void forEach(Look look) const {
    for (const auto& standing : standings(SIZE_MAX)) look(standing->view());
  }

 private:
  struct List;
  [[nodiscard]] std::vector<std::shared_ptr<SessionStanding>> standings(size_t most) const;
  const std::shared_ptr<List> list_ = makeList();
  static std::shared_ptr<List> makeList();
};

// The longest beginning of whole UTF-8 characters of at most Limits::maxBookNameBytes.
[[nodiscard]] std::string shownName(std::string_view name);

}  // namespace kyt
