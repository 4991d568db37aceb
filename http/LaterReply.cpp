#include "http/LaterReply.h"

#include <utility>

namespace kyt::http {

void LaterReply::give(Reply reply) {
  MutexLock lock(mutex_);
  reply_ = std::move(reply);
  if (suspended_ != nullptr) MHD_resume_connection(std::exchange(suspended_, nullptr));
}

std::optional<Reply> LaterReply::takeOrSuspend(MHD_Connection* connection) {
  MutexLock lock(mutex_);
  if (reply_) return std::exchange(reply_, std::nullopt);
  MHD_suspend_connection(connection);
  suspended_ = connection;
  return std::nullopt;
}

}  // namespace kyt::http
