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

const std::shared_ptr<SerialQueue>& Completions::queueOf(const URLTransfer& transfer) {
  std::vector<std::shared_ptr<SerialQueue>>& queues = transfer.session->queues;
  const uint64_t owner = transfer.user.owner();
  for (const std::shared_ptr<SerialQueue>& queue : queues)
    if (queue->owner() == owner) return queue;
  return queues.emplace_back(SerialQueue::create("URL session", *workers_, owner));
}

void Completions::run(std::shared_ptr<URLTransfer> transfer) {
  const std::shared_ptr<SerialQueue> queue = queueOf(*transfer);
  queue->async([delivered = std::move(transfer)] { delivered->deliver(); });
}

bool Completions::shutDownWithin(Duration patience) {
  return !workers_ || workers_->shutDownWithin(patience);
}

void Completions::shutDown() {
  if (workers_) workers_->shutDown();
}

}  // namespace kyt
