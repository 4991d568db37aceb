// The daemon's side of the IPC service with sessions that only record, on a real socket: what the client
// library's tests talk to. May be stopped and started again, as a daemon that dies and returns.
#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Entitlements.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/DBusServer.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/UnixSocket.h"
#include "platform/queues/Log.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {

// What one connection's client asked for, as texts in order: "SetSessionInfo …", "Send 1 2 …", and so on.
struct RecordedCalls {
  mutable std::mutex mutex;
  std::vector<std::string> calls;
  Dictionary lastPayload;
  bool holdFlush = false;
  bool answersConfiguration = true;
  std::optional<Array> states;
  std::vector<ResultReply> heldFlushes;
  Connection* connection = nullptr;
  void add(std::string call) {
    const std::lock_guard lock(mutex);
    calls.push_back(std::move(call));
  }
};

class TestDaemon final : public ListenerDelegate, private Entitlements {
 public:
  explicit TestDaemon(std::string socketPath) : path_(std::move(socketPath)) {}
  ~TestDaemon() override { stop(); }

  [[nodiscard]] bool start();
  // Every connection ends, the socket goes.
  void stop();
  void setAccepts(bool accepts) { accepts_ = accepts; }
  // The next so many connections are refused without a word, or told that the daemon ends.
  void setRefusals(int count) { refusals_ = count; }
  void setEndings(int count) { endings_ = count; }
  // What configurations of later connections bring; none: there is no storebag.
  void setStates(std::optional<Array> states) {
    const std::lock_guard lock(mutex_);
    states_ = std::move(states);
  }
  void setHoldFlush(bool hold) { holdFlush_ = hold; }
  // Whether configurations of later connections are answered, or end in an error.
  void setAnswersConfigurations(bool answers) { answersConfigurations_ = answers; }

  [[nodiscard]] size_t connections() const;
  // All calls of all connections so far, in order.
  [[nodiscard]] std::vector<std::string> calls() const;
  [[nodiscard]] size_t count(const std::string& prefix) const;
  [[nodiscard]] Dictionary lastPayload() const;
  // To the newest connection's client.
  void sendToClient(std::optional<Dictionary> info, double timestamp, uint16_t category, uint16_t type,
                    std::optional<Dictionary> payload);

  [[nodiscard]] bool listenerShouldAcceptNewConnection(
      Listener& listener, const std::shared_ptr<Connection>& connection) override;

 private:
  [[nodiscard]] Value valueFor(const PeerCredentials&, std::string_view) override { return entitled_.load(); }

  struct Running;
  const std::string path_;
  std::atomic<bool> accepts_{true}, holdFlush_{false}, answersConfigurations_{true};
  std::atomic<int> refusals_{0}, endings_{0};
  std::atomic<bool> entitled_{true};
  std::optional<Array> states_ = Array{"httppost", "qrs"};
  Limits limits_;
  UserBudget budget_{UserShares::of(limits_, uint64_t{1} << 30, 65536)};
  Counters counters_;
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::error};
  LinuxClock clock_;
  std::unique_ptr<EpollReactor> reactor_;
  std::unique_ptr<WorkerPool> pool_;
  std::unique_ptr<DBusServer> server_;
  mutable std::mutex mutex_;
  std::vector<std::shared_ptr<RecordedCalls>> records_;
  std::vector<std::shared_ptr<Connection>> connections_;
};

}  // namespace kyt
