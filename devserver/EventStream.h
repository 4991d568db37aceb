// Server-Sent Events: what is published goes to every page that listens. Each listener has a bounded queue;
// one that does not keep up loses messages and is told so with an "overflow" event, upon which the page asks
// anew. Any thread.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "http/StreamQueue.h"
#include "platform/base/Mutex.h"

namespace kyt::devserver {

using http::StreamQueue;

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
