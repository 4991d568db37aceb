// An answer without an end: what is pushed goes to the one who listens, as long as it keeps up. Any thread.
#pragma once

#include <microhttpd.h>

#include <string>
#include <string_view>

#include "platform/base/Mutex.h"

namespace kyt::http {

// One listener's queue. Its connection is suspended while there is nothing to send.
class StreamQueue {
 public:
  static constexpr size_t kMaxBytes = 4 << 20;

  void push(std::string_view message) EXCLUDES(mutex_);
  void close() EXCLUDES(mutex_);  // the stream ends after what is queued

  // For HttpServer, on the connection's thread: up to `size` bytes, 0 when the connection was suspended, -1
  // at the end.
  [[nodiscard]] ssize_t read(MHD_Connection* connection, char* out, size_t size) EXCLUDES(mutex_);

 private:
  Mutex mutex_;
  std::string bytes_ GUARDED_BY(mutex_);
  size_t sent_ GUARDED_BY(mutex_) = 0;
  MHD_Connection* suspended_ GUARDED_BY(mutex_) = nullptr;
  bool closed_ GUARDED_BY(mutex_) = false;
  bool overflowed_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt::http
