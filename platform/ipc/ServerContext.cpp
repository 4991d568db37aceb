#include "platform/ipc/ServerContext.h"

#include <utility>

#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/ClientSessionDispatcher.h"
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
      dispatcher(services.dispatcher != nullptr
                     ? services.dispatcher
                     : std::make_shared<ClientSessionDispatcher>(services.counters, services.machineId)) {}

std::optional<Reason> ServerContext::admit(UserAccount& user) {
  MutexLock lock(mutex_);
  if (count_ >= services.limits.maxConnections) return Reason::tooManyConnections;
  if (!user.take(Share::connections, 1)) return Reason::tooManyConnectionsOfUser;
  if (!user.take(Share::descriptors, 1)) {
    user.giveBack(Share::connections, 1);
    return Reason::tooManyDescriptorsOfUser;
  }
  if (!user.take(Share::bytes, Limits::connectionBytes)) {
    user.giveBack(Share::connections, 1);
    user.giveBack(Share::descriptors, 1);
    return Reason::userBytesExceeded;
  }
  ++count_;
  return std::nullopt;
}

void ServerContext::enlist(uint64_t number, std::shared_ptr<DBusConnection> connection) {
  MutexLock lock(mutex_);
  connections_.emplace(number, std::move(connection));
}

void ServerContext::remove(uint64_t number, UserAccount& user) {
  std::shared_ptr<DBusConnection> connection;  // dropped without the lock
  MutexLock lock(mutex_);
  const auto found = connections_.find(number);
  if (found == connections_.end()) return;
  connection = std::move(found->second);
  connections_.erase(found);
  --count_;
  user.giveBack(Share::connections, 1);
  user.giveBack(Share::descriptors, 1);
  user.giveBack(Share::bytes, Limits::connectionBytes);
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
