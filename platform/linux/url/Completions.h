// Where the completions of requests run: serial queues, one for each user in each session, on a small pool of threads of
// their own ("kyt-url"). Each queue has the user as its owner, so users take turns there as they do everywhere else:
// neither a session that many users share nor many sessions of one user put others behind all of one user's completions.
#pragma once

#include <memory>

#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {

class SerialQueue;
class URLTransfer;

class Completions {
 public:
  // Network thread: once, before the first run(); it starts no thread.
  void begin(const CurlURLSessionOptions& options);
  // Network thread. Hands the request, whose result is set, to its user's queue of its session.
  void run(std::shared_ptr<URLTransfer> transfer);
  // Any thread, when the network thread has ended: waits for what runs, and ends the threads. False when some still
  // run after `patience`.
  [[nodiscard]] bool shutDownWithin(Duration patience);
  void shutDown();

 private:
  [[nodiscard]] const std::shared_ptr<SerialQueue>& queueOf(const URLTransfer& transfer);
  std::unique_ptr<WorkerPool> workers_;
};

}  // namespace kyt
