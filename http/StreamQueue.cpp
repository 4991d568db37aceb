#include "http/StreamQueue.h"

#include <algorithm>
#include <cstring>
#include <utility>

namespace kyt::http {

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

}  // namespace kyt::http
