// How the storebags stand, for whoever looks from outside: published by the agent after each download, so that a reader does
// not wait for the next, during which the agent's monitor is held. Any thread.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/objects/Value.h"

namespace kyt {

struct StorebagView {
  enum class State : uint8_t {
    good,      // the server's, or it said that the last one holds
    fallback,  // the built-in one, since the server could not be reached
    failed     // the last good one is in force, if there is one
  };
  std::string name;
  std::string version;  // in force; empty: none
  std::string address;  // where it was asked for last
  int64_t fetched = 0;  // when it was, seconds since 1970
  int64_t expires = 0;  // when it is asked for again, at the earliest
  State state = State::good;
  std::string lastError;  // empty: none yet
  int64_t lastErrorAt = 0;
  Dictionary section;  // in force, of the environment in force
};

class StorebagStandings {
 public:
  // What went wrong before stays, where this went well.
  void publish(StorebagView view) EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    StorebagView& known = views_[view.name];
    if (view.lastError.empty()) {
      view.lastError = std::move(known.lastError);
      view.lastErrorAt = known.lastErrorAt;
    }
    known = std::move(view);
  }
  // None of that name was asked for: none.
  [[nodiscard]] std::optional<StorebagView> view(const std::string& name) const EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    const auto known = views_.find(name);
    return known != views_.end() ? std::optional(known->second) : std::nullopt;
  }
  // By name.
  [[nodiscard]] std::vector<StorebagView> views() const EXCLUDES(mutex_) {
    std::vector<StorebagView> views;
    MutexLock lock(mutex_);
    for (const auto& [name, view] : views_) views.push_back(view);
    return views;
  }

 private:
  mutable Mutex mutex_;
  std::map<std::string, StorebagView> views_ GUARDED_BY(mutex_);  // one for each family of clients
};

}  // namespace kyt
