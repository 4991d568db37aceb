// The library's thread: one for the process, started with the first session, ended with the last. It waits
// for all sessions' sockets at once.
//
// While messages flow it looks at the queues every millisecond by itself, so that reporting needs no system
// call and the messages of a millisecond leave in one write; after a pause it sleeps until the next message
// wakes it. A Loop is never destroyed (a process may end while it runs); a forked child gets a new one.
#pragma once

#include <atomic>
#include <memory>
#include <unordered_set>
#include <vector>

#include "client/Session.h"
#include "platform/base/Mutex.h"
#include "platform/linux/client/ClientSocket.h"

namespace kyt::client {

class Loop {
 public:
  // The process's loop.
  static Loop* current();

  // The session ends at once where the system gives no thread; others that have one, or get one, do not.
  void add(const std::shared_ptr<Session>& session);
  // Closes each session; on the library's thread those end with the running completion.
  void closeAll() EXCLUDES(mutex_);
  // A session's figures are part of the process's from its making to its end, and stay so. Any thread.
  void enroll(const Session& session) EXCLUDES(mutex_);
  void retire(const Session& session) EXCLUDES(mutex_);
  // Of what was refused without a session.
  void addToTotals(const KYTReporting::Statistics& figures) EXCLUDES(mutex_);
  [[nodiscard]] KYTReporting::Statistics totals() EXCLUDES(mutex_);

  // After something was queued: wakes the thread only if it sleeps.
  void noticeWork();
  // Wakes it whatever it does: a session was closed.
  void wake() { wakeUp_.wake(); }
  [[nodiscard]] bool isCurrentThread() const;
  // Whether the thread waits until something is queued, instead of looking by itself: a snapshot, possibly stale.
  [[nodiscard]] bool sleeps() const { return sleeping_.load(); }

 private:
  Loop() = default;
  void run();
  using Sessions = std::vector<std::shared_ptr<Session>>;
  [[nodiscard]] Sessions sessionsLeft() REQUIRES(libraryThread);
  static bool turn(const Sessions& sessions) REQUIRES(libraryThread);
  [[nodiscard]] static bool anyHasWork(const Sessions& sessions) REQUIRES(libraryThread);
  [[nodiscard]] static bool anyIsDone(const Sessions& sessions) REQUIRES(libraryThread);
  void wait(const Sessions& sessions, bool active, linux_client::WaitSet& waits) REQUIRES(libraryThread);
  [[nodiscard]] std::chrono::milliseconds timeout(const Sessions& sessions, bool active) const
      REQUIRES(libraryThread);
  static void installForkHandlers();

  linux_client::WakeUp wakeUp_;
  std::atomic<bool> sleeping_{false};
  Mutex mutex_;
  Sessions sessions_ GUARDED_BY(mutex_);
  bool running_ GUARDED_BY(mutex_) = false;
  std::unordered_set<const Session*> counted_ GUARDED_BY(mutex_);  // those that live
  KYTReporting::Statistics countedBefore_ GUARDED_BY(mutex_);      // of those that do not
};

}  // namespace kyt::client
