#include "devserver/EventStream.h"

#include <utility>

namespace kyt::devserver {

std::shared_ptr<StreamQueue> EventStream::listen() {
  MutexLock lock(mutex_);
  if (closed_ || alive().size() >= kMaxListeners) return nullptr;
  auto queue = std::make_shared<StreamQueue>();
  queue->push(": kytdevserver\n\n");
  listeners_.push_back(queue);
  return queue;
}

void EventStream::publish(std::string_view event, std::string_view json) {
  std::string message = "event: ";
  message.append(event).append("\ndata: ").append(json).append("\n\n");
  send(message);
}

void EventStream::heartbeat() {
  send(": still here\n\n");
}

bool EventStream::hasListeners() {
  MutexLock lock(mutex_);
  return !alive().empty();
}

void EventStream::close() {
  std::vector<std::shared_ptr<StreamQueue>> queues;
  {
    MutexLock lock(mutex_);
    closed_ = true;
    queues = alive();
  }
  for (const auto& queue : queues) queue->close();
}

void EventStream::send(std::string_view message) {
  std::vector<std::shared_ptr<StreamQueue>> queues;
  {
    MutexLock lock(mutex_);
    queues = alive();
  }
  for (const auto& queue : queues) queue->push(message);
}

std::vector<std::shared_ptr<StreamQueue>> EventStream::alive() {
  std::vector<std::shared_ptr<StreamQueue>> queues;
  std::erase_if(listeners_, [&](const std::weak_ptr<StreamQueue>& listener) {
    auto queue = listener.lock();
    if (!queue) return true;
    queues.push_back(std::move(queue));
    return false;
  });
  return queues;
}

}  // namespace kyt::devserver
