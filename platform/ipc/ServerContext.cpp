#include "platform/ipc/ServerContext.h"

#include <utility>

#include "platform/Limits.h"
#include "platform/ipc/DBusConnection.h"

namespace kyt {

ReadBuffers::Buffer ReadBuffers::take() {
  {
    MutexLock lock(mutex_);
    if (!kept_.empty()) {
      Buffer buffer = std::move(kept_.back());
      kept_.pop_back();
      return buffer;
    }
  }
  return std::make_unique_for_overwrite<std::byte[]>(kBytes);
}

void ReadBuffers::give(Buffer buffer) {
  MutexLock lock(mutex_);
  if (kept_.size() < kMostKept) kept_.push_back(std::move(buffer));
}

ServerContext::ServerContext(DBusServerServices given)
    : services(std::move(given)),
      dispatcher(services.counters,
                 {.machineId = services.machineId, .introspection = clientSessionIntrospection()}) {}

ServerContext::Admission ServerContext::admit(uint32_t user) {
  MutexLock lock(mutex_);
  if (count_ >= services.limits.maxConnections) return Admission::tooMany;
  size_t& ofUser = countOfUser_[user];
  if (ofUser >= services.limits.maxConnectionsPerUser) return Admission::tooManyOfUser;
  ++ofUser;
  ++count_;
  return Admission::admitted;
}

void ServerContext::enlist(uint64_t number, std::shared_ptr<DBusConnection> connection) {
  MutexLock lock(mutex_);
  connections_.emplace(number, std::move(connection));
}

void ServerContext::remove(uint64_t number, uint32_t user) {
  std::shared_ptr<DBusConnection> connection;  // dropped without the lock
  MutexLock lock(mutex_);
  const auto found = connections_.find(number);
  if (found == connections_.end()) return;
  connection = std::move(found->second);
  connections_.erase(found);
  --count_;
  const auto ofUser = countOfUser_.find(user);
  if (--ofUser->second == 0) countOfUser_.erase(ofUser);
}

size_t ServerContext::connectionCount() const {
  MutexLock lock(mutex_);
  return count_;
}

std::vector<std::shared_ptr<DBusConnection>> ServerContext::connections() const {
  MutexLock lock(mutex_);
  std::vector<std::shared_ptr<DBusConnection>> all;
  all.reserve(connections_.size());
  for (const auto& [number, connection] : connections_) all.push_back(connection);
  return all;
}

}  // namespace kyt
