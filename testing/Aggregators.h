// The fake daemon's sessions that aggregate: each message goes to the top-most of its hierarchy, or to its own session. Any
// thread. Starts and ends of sessions, which the real daemon makes messages of, are left out.
#pragma once

#include <map>
#include <memory>

#include "kytreporting/FakeDaemon.h"
#include "platform/base/Mutex.h"
#include "platform/ipc/Listener.h"

namespace kyt::testing {

class Aggregators {
 public:
  // A session said who it is; again: it is somebody else now.
  void add(const Event& session, std::weak_ptr<Connection> connection) EXCLUDES(mutex_);
  void remove(uint64_t connection) EXCLUDES(mutex_);
  // A message of that connection's session.
  void offer(const Event& message) EXCLUDES(mutex_);

 private:
  struct Member {
    Dictionary info;    // session information, with the user's over it
    std::string token;  // empty: in no hierarchy
    uint32_t level = 0;
    bool aggregates = false;
    std::weak_ptr<Connection> connection;
  };
  [[nodiscard]] const Member* aggregatorOf(const Member& sender) const REQUIRES(mutex_);

  Mutex mutex_;
  std::map<uint64_t, Member> members_ GUARDED_BY(mutex_);  // by their connections' numbers
};

}  // namespace kyt::testing
