// Connections that wait for something: they are suspended, so that they cost neither a thread nor a poll, and
// resumed when somebody wakes them or their deadline comes. One thread watches the deadlines; it also calls a
// tick every few seconds, for heartbeats. Any thread.
#pragma once

#include <microhttpd.h>

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <thread>

#include "http/Http.h"
#include "platform/base/Mutex.h"

namespace kyt::http {

class Suspensions {
 public:
  explicit Suspensions(std::function<void()> tick);
  ~Suspensions();  // stop()

  // To be read before a condition is looked at.
  [[nodiscard]] uint64_t generation() EXCLUDES(mutex_);
  // Suspends the connection unless wake() was called since `generation` was read, or everything stops. Called
  // by the connection's own thread. False: it was not suspended, look again.
  [[nodiscard]] bool suspend(MHD_Connection* connection, const Wait& wait, uint64_t generation)
      EXCLUDES(mutex_);
  // Resumes the connections that wait for this; a change of the rules resumes all.
  void wake(WaitFor what) EXCLUDES(mutex_);
  void stop() EXCLUDES(mutex_);  // resumes all, for ever
  [[nodiscard]] bool stopped() EXCLUDES(mutex_);

 private:
  struct Waiting {
    MHD_Connection* connection;
    WaitFor what;
  };
  void run() EXCLUDES(mutex_);

  const std::function<void()> tick_;
  Mutex mutex_;
  std::condition_variable_any changed_;
  std::multimap<SteadyTime, Waiting> waiting_ GUARDED_BY(mutex_);
  uint64_t generation_ GUARDED_BY(mutex_) = 0;
  bool stopped_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

}  // namespace kyt::http
