// The IPC listener in memory, for tests of the agent and its sessions: a test connects, calls the exported
// object as a client would, breaks or ends the connection, and reads what was sent to the client.
#pragma once

#include <algorithm>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base/Mutex.h"
#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/Listener.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

// One call of sendMessageToClient.
struct MessageToClient {
  std::optional<Dictionary> sessionInfo;
  double timestamp = 0;
  uint16_t category = 0, type = 0;
  std::optional<Dictionary> payload;
};

// Everything may be called from any thread. As with a real connection, the exported object and the handlers
// run on queue(), the invalidation handler exactly once, after which both handlers and the exported object
// are dropped.
class FakeConnection final : public Connection, private ClientSessionReplyInterface {
 public:
  explicit FakeConnection(std::shared_ptr<SerialQueue> queue, uint32_t user = 1000);

  // What a test prepares and asks.
  void setEntitlement(std::string_view key, Value value);
  void setGroups(std::vector<uint32_t> groups) { groups_ = std::move(groups); }
  void setUserAccount(std::shared_ptr<UserAccount> account) { account_ = std::move(account); }
  void setDescription(std::string description) { description_ = std::move(description); }
  // From now on sendMessageToClient fails with this (none: succeeds again).
  void setSendError(std::optional<Error> error);
  [[nodiscard]] std::vector<MessageToClient> messagesToClient() const;
  [[nodiscard]] bool resumed() const;
  [[nodiscard]] bool invalidated() const;  // the invalidation handler has run
  [[nodiscard]] std::shared_ptr<ClientSessionInterface> exportedObject() const;  // where it is one
  [[nodiscard]] std::shared_ptr<ExportedObject> anyExportedObject() const;

  // What a client does. Each runs on queue() before returning (so not from that queue); a call on a
  // connection that has no exported object any more is not made: false.
  template <typename F>
  bool call(F&& f) {
    bool called = false;
    queue_->sync([&] {
      if (std::shared_ptr<ClientSessionInterface> object = exportedObject()) {
        f(*object);
        called = true;
      }
    });
    return called;
  }
  void interruptNow();
  void invalidateNow();

  [[nodiscard]] Value entitlementValue(std::string_view key) override;
  [[nodiscard]] std::string description() const override { return description_; }
  [[nodiscard]] uint32_t peerUser() const override { return user_; }
  [[nodiscard]] bool isPeerInGroup(uint32_t group) const override {
    return std::find(groups_.begin(), groups_.end(), group) != groups_.end();
  }
  [[nodiscard]] std::shared_ptr<UserAccount> userAccount() const override { return account_; }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  void setInterruptionHandler(Task handler) override;
  void setInvalidationHandler(Task handler) override;
  void resume() override;
  void invalidate() override;
  void finish() override { invalidate(); }
  [[nodiscard]] ClientSessionReplyInterface& remoteObjectProxy() override { return *this; }
  [[nodiscard]] const std::shared_ptr<SerialQueue>& queue() const override { return queue_; }

 private:
  struct State;
  static void runInvalidation(State& state);
  [[nodiscard]] std::optional<Error> sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                         double timestamp, uint16_t category, uint16_t type,
                                                         std::optional<Dictionary> payload) override;
  const std::shared_ptr<SerialQueue> queue_;
  const uint32_t user_;
  std::shared_ptr<UserAccount> account_;  // none: nothing is counted
  std::string description_;
  std::vector<uint32_t> groups_;
  const std::shared_ptr<State> state_;  // pending work on the queue outlives the connection
};

class FakeListener final : public Listener {
 public:
  void setDelegate(ListenerDelegate& delegate) override { delegate_ = &delegate; }
  void resume() override { accepting_ = true; }
  void stopAccepting() override { accepting_ = false; }

  // Offers a connection to the delegate, on the connection's queue. Whether it was accepted: false too when
  // the listener is not accepting, or has no delegate.
  bool connect(const std::shared_ptr<FakeConnection>& connection);

 private:
  ListenerDelegate* delegate_ = nullptr;
  bool accepting_ = false;
};

}  // namespace kyt
