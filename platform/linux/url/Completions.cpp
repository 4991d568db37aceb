#include "platform/linux/url/Completions.h"

#include <utility>

#include "platform/linux/base/Threads.h"
#include "platform/linux/url/URLSessionState.h"
#include "platform/linux/url/URLTransfer.h"

namespace kyt {

void Completions::begin(const CurlURLSessionOptions& session) {
  WorkerPoolOptions options;
  options.idleExit = session.quietTime;
  options.whenQuiet = session.whenQuiet;
  options.runnable = 2;
  options.maxWorkers = 4;
  options.name = "kyt-url";
  options.nameThread = beginServiceThread;
  workers_ = std::make_unique<WorkerPool>(options);
}

void Completions::run(std::shared_ptr<URLTransfer> transfer) {
  URLSessionState& session = *transfer->session;
  if (!session.queue) session.queue = SerialQueue::create("URL session", *workers_);
  const std::shared_ptr<SerialQueue> queue = session.queue;
  queue->async([delivered = std::move(transfer)] { delivered->deliver(); });
}

bool Completions::shutDownWithin(Duration patience) {
  return !workers_ || workers_->shutDownWithin(patience);
}

void Completions::shutDown() {
  if (workers_) workers_->shutDown();
}

}  // namespace kyt
