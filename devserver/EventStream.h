// Server-Sent Events: what is published goes to every page that listens. Each listener has a bounded queue;
// one that does not keep up loses messages and is told so with an "overflow" event, upon which the page asks
// anew. Any thread.
#pragma once

#include <microhttpd.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Mutex.h"

namespace kyt::devserver {

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
  std::string bytes_ GUARDED_BY(mutex_) = ": kytdevserver\n\n";
  size_t sent_ GUARDED_BY(mutex_) = 0;
  MHD_Connection* suspended_ GUARDED_BY(mutex_) = nullptr;
  bool closed_ GUARDED_BY(mutex_) = false;
  bool overflowed_ GUARDED_BY(mutex_) = false;
};

class EventStream {
 public:
  static constexpr size_t kMaxListeners = 64;

  // Null when there are too many or the server stops.
  [[nodiscard]] std::shared_ptr<StreamQueue> listen() EXCLUDES(mutex_);
  void publish(std::string_view event, std::string_view json) EXCLUDES(mutex_);
  void heartbeat() EXCLUDES(mutex_);  // finds listeners that are gone
  [[nodiscard]] bool hasListeners() EXCLUDES(mutex_);
  void close() EXCLUDES(mutex_);

 private:
  void send(std::string_view message) EXCLUDES(mutex_);
  [[nodiscard]] std::vector<std::shared_ptr<StreamQueue>> alive() REQUIRES(mutex_);

  Mutex mutex_;
  std::vector<std::weak_ptr<StreamQueue>> listeners_ GUARDED_BY(mutex_);
  bool closed_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt::devserver
