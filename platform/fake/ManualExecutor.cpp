#include "platform/fake/ManualExecutor.h"

#include <utility>

#include "platform/queues/SerialQueue.h"

namespace kyt {

void ManualExecutor::submit(std::shared_ptr<SerialQueue> queue) {
  {
    MutexLock lock(mutex_);
    if (!shutDown_) {
      queues_.push_back(std::move(queue));
      return;
    }
  }
  queue->discardPending();
}

std::shared_ptr<SerialQueue> ManualExecutor::takeFirst() {
  MutexLock lock(mutex_);
  if (queues_.empty()) return nullptr;
  std::shared_ptr<SerialQueue> queue = std::move(queues_.front());
  queues_.pop_front();
  return queue;
}

bool ManualExecutor::runOne() {
  const std::shared_ptr<SerialQueue> queue = takeFirst();
  if (queue) queue->runPending();
  return queue != nullptr;
}

size_t ManualExecutor::runAll() {
  size_t turns = 0;
  while (runOne()) ++turns;
  return turns;
}

size_t ManualExecutor::pending() const {
  MutexLock lock(mutex_);
  return queues_.size();
}

void ManualExecutor::shutDown() {
  {
    MutexLock lock(mutex_);
    shutDown_ = true;
  }
  while (const std::shared_ptr<SerialQueue> queue = takeFirst()) queue->discardPending();
}

}  // namespace kyt
