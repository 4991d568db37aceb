// What the connections of one server share: the services they use, the table of connections with its limits,
// and the read buffers that are lent for a turn. Lives as long as the last of them. Any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"
#include "platform/ipc/MessageDispatcher.h"

namespace kyt {

class Clock;
class DBusConnection;
class Entitlements;
class Executor;
class Log;
class Reactor;
class TimerService;
class UserAccount;
class UserBudget;
struct Limits;

// Everything outlives the server and its connections.
struct DBusServerServices {
  const Limits& limits;
  Counters& counters;
  Log& log;
  Clock& clock;
  TimerService& timers;
  Executor& executor;
  Reactor& reactor;
  Entitlements& entitlements;
  UserBudget& budget;
  std::string machineId;  // 32 hexadecimal digits; also the server's GUID in the handshake
  // Null: ClientSessionDispatcher, thus the objects that the delegate exports are sessions.
  std::shared_ptr<const MessageDispatcher> dispatcher = nullptr;
};

// Buffers for large reads, lent to a turn: an idle connection holds none. A few stay for the next turns.
class ReadBuffers {
 public:
  static constexpr size_t kBytes = 65536;
  using Buffer = std::unique_ptr<std::byte[]>;
  [[nodiscard]] Buffer take();
  void give(Buffer buffer);

 private:
  static constexpr size_t kMostKept = 4;
  Mutex mutex_;
  std::vector<Buffer> kept_ GUARDED_BY(mutex_);
};

class ServerContext {
 public:
  explicit ServerContext(DBusServerServices services);

  // Counts a connection of that user, or says why there is no room for it.
  [[nodiscard]] std::optional<Reason> admit(UserAccount& user);
  void enlist(uint64_t number, std::shared_ptr<DBusConnection> connection);
  void remove(uint64_t number, UserAccount& user);
  [[nodiscard]] size_t connectionCount() const;
  [[nodiscard]] std::vector<std::shared_ptr<DBusConnection>> connections() const;

  const DBusServerServices services;
  const std::shared_ptr<const MessageDispatcher> dispatcher;
  ReadBuffers buffers;

 private:
  mutable Mutex mutex_;
  size_t count_ GUARDED_BY(mutex_) = 0;
  std::unordered_map<uint64_t, std::shared_ptr<DBusConnection>> connections_ GUARDED_BY(mutex_);
};

}  // namespace kyt
