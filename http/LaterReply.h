// The answer to a request that is known later: whoever holds it gives the reply, from any thread; meanwhile the connection
// is suspended and costs none.
#pragma once

#include <microhttpd.h>

#include <optional>

#include "http/Http.h"
#include "platform/base/Mutex.h"

namespace kyt::http {

class LaterReply {
 public:
  // Once. Every reply is given before its server ends.
  void give(Reply reply) EXCLUDES(mutex_);

  // For HttpServer, on the connection's thread: the reply, or none when the connection was suspended, in which case this
  // is called again once it is there.
  [[nodiscard]] std::optional<Reply> takeOrSuspend(MHD_Connection* connection) EXCLUDES(mutex_);

 private:
  Mutex mutex_;
  std::optional<Reply> reply_ GUARDED_BY(mutex_);
  MHD_Connection* suspended_ GUARDED_BY(mutex_) = nullptr;
};

}  // namespace kyt::http
