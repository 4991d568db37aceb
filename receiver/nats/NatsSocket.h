// The connection of NATS' client library, read and written by us: left to itself the library has a thread that reads and one
// that delivers, and each post wakes both. Here one thread waits for the socket; who publishes writes at once, and what the
// server does not take then that thread writes later.
//
// Threads: wait() by one; the library attaches and detaches from its own; the rest any.
#pragma once

#include <nats/nats.h>

#include <atomic>
#include <chrono>

#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"
#include "platform/linux/base/Descriptors.h"

namespace kyt::receiver {

class NatsSocket {
 public:
  // A server that takes nothing for `writeTime` has its connection ended; the library then looks for another.
  explicit NatsSocket(std::chrono::milliseconds writeTime);
  NatsSocket(const NatsSocket&) = delete;
  NatsSocket& operator=(const NatsSocket&) = delete;

  // `secure`: the connection will have TLS, whose state must not be read and written at once. Before the library connects;
  // this outlives the connection.
  [[nodiscard]] natsStatus use(natsOptions* options, bool secure);
  // Gives it to the library, which keeps it for flush().
  [[nodiscard]] static natsStatus publish(natsConnection* connection, natsMsg* message);
  // Writes what the library has. Never blocks: what the server does not take stays in the library.
  void flush() EXCLUDES(ioMutex_);
  [[nodiscard]] Duration sinceFlush() const;
  // The library holds bytes that the server did not take. Once it has taken them wait() returns.
  [[nodiscard]] bool isBehind() const { return isBehind_.load(); }
  // Until something was read or written, or wake() was called, or that time.
  void wait(Duration most) EXCLUDES(ioMutex_);
  void wake() { signalEventDescriptor(wake_.get()); }

 private:
  static natsStatus attach(void** data, void* self, natsConnection* connection, natsSock socket);
  static natsStatus watchReads(void* self, bool add);
  static natsStatus watchWrites(void* self, bool add);
  static natsStatus detach(void* self);
  void watch(bool writes) EXCLUDES(mutex_);
  void leave() EXCLUDES(mutex_);
  void read() EXCLUDES(ioMutex_);
  [[nodiscard]] natsConnection* connection() EXCLUDES(mutex_);
  void noteProgress() EXCLUDES(mutex_);
  void endSlow() EXCLUDES(mutex_);

  const std::chrono::milliseconds writeTime_;
  const Descriptor epoll_, wake_;
  bool isSecure_ = false;
  std::atomic<bool> wantsWrite_{false};  // the library does
  std::atomic<bool> isBehind_{false};    // and epoll waits for the server
  std::atomic<MonotonicTime> flushedAt_{MonotonicTime{}};
  Mutex ioMutex_;  // held while the library writes and, with TLS, while it reads
  Mutex mutex_;    // taken with the library's lock held: never call the library with it
  natsConnection* connection_ GUARDED_BY(mutex_) = nullptr;
  natsSock socket_ GUARDED_BY(mutex_) = -1;
  MonotonicTime progressAt_ GUARDED_BY(mutex_){};
};

}  // namespace kyt::receiver
