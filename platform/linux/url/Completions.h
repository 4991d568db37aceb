// Where the completions of requests run: a serial queue of each session, on a small pool of threads of their own
// ("kyt-url").
#pragma once

#include <memory>

#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {

class URLTransfer;

class Completions {
 public:
  // Network thread: once, before the first run(); it starts no thread.
  void begin(const CurlURLSessionOptions& options);
  // Network thread. Hands the request, whose result is set, to its session's queue.
  void run(std::shared_ptr<URLTransfer> transfer);
  // Any thread, when the network thread has ended: waits for what runs, and ends the threads. False when some still
  // run after `patience`.
  [[nodiscard]] bool shutDownWithin(Duration patience);
  void shutDown();

 private:
  std::unique_ptr<WorkerPool> workers_;
};

}  // namespace kyt
