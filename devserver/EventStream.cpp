#include "devserver/EventStream.h"

#include <algorithm>
#include <cstring>
#include <utility>

namespace kyt::devserver {

void StreamQueue::push(std::string_view message) {
  MutexLock lock(mutex_);
  if (closed_) return;
  if (bytes_.size() - sent_ + message.size() <= kMaxBytes) {
    bytes_ += message;
    overflowed_ = false;
  } else if (!overflowed_) {
    bytes_ += "event: overflow\ndata: {}\n\n";
    overflowed_ = true;
  }
  if (suspended_ != nullptr) MHD_resume_connection(std::exchange(suspended_, nullptr));
}

void StreamQueue::close() {
  MutexLock lock(mutex_);
  closed_ = true;
  if (suspended_ != nullptr) MHD_resume_connection(std::exchange(suspended_, nullptr));
}

ssize_t StreamQueue::read(MHD_Connection* connection, char* out, size_t size) {
  MutexLock lock(mutex_);
  if (sent_ == bytes_.size()) {
    if (closed_) return MHD_CONTENT_READER_END_OF_STREAM;
    MHD_suspend_connection(connection);
    suspended_ = connection;
    return 0;
  }
  const size_t count = std::min(size, bytes_.size() - sent_);
  std::memcpy(out, bytes_.data() + sent_, count);
  sent_ += count;
  if (sent_ == bytes_.size() || sent_ > kMaxBytes / 2) {
    bytes_.erase(0, sent_);
    sent_ = 0;
  }
  return static_cast<ssize_t>(count);
}

std::shared_ptr<StreamQueue> EventStream::listen() {
  MutexLock lock(mutex_);
  if (closed_ || alive().size() >= kMaxListeners) return nullptr;
  auto queue = std::make_shared<StreamQueue>();
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
