// The locks of this project, annotated so that clang's thread-safety analysis can check every guarded field. Serial queues
// (platform/queues/SerialQueue.h) are annotated with the same macros.
//
// `Mutex` is for the few private, short critical sections; any thread, no system call without contention. What many wait
// for, or for long, is a Monitor or a Gate (platform/queues/). docs/THREADS.md has the order of locks.
#pragma once

#include <mutex>

#if defined(__clang__)
#define KYT_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define KYT_THREAD_ANNOTATION(x)
#endif

#define CAPABILITY(x) KYT_THREAD_ANNOTATION(capability(x))
#define SCOPED_CAPABILITY KYT_THREAD_ANNOTATION(scoped_lockable)
#define GUARDED_BY(x) KYT_THREAD_ANNOTATION(guarded_by(x))
#define PT_GUARDED_BY(x) KYT_THREAD_ANNOTATION(pt_guarded_by(x))
#define REQUIRES(...) KYT_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define EXCLUDES(...) KYT_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
#define ACQUIRE(...) KYT_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define RELEASE(...) KYT_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) KYT_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) KYT_THREAD_ANNOTATION(assert_capability(x))
#define RETURN_CAPABILITY(x) KYT_THREAD_ANNOTATION(lock_returned(x))
#define NO_THREAD_SAFETY_ANALYSIS KYT_THREAD_ANNOTATION(no_thread_safety_analysis)

namespace kyt {

class CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;
  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }
  [[nodiscard]] bool tryLock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }
  // For ConditionVariable (ConditionVariable.h) alone, which waits with it.
  std::mutex& native() { return mutex_; }

 private:
  std::mutex mutex_;
};

class SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
  ~MutexLock() RELEASE() { mutex_.unlock(); }
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

 private:
  Mutex& mutex_;
};

}  // namespace kyt
