// What the daemon calls on a connection's client: the real remote object proxy. It counts what it drops, and says so in
// the log.
#pragma once

#include <cstdint>

#include "platform/ipc/ClientSessionInterface.h"
#include "platform/ipc/ConnectionOutput.h"
#include "platform/ipc/ServerContext.h"

namespace kyt {

class RemoteClient final : public ClientSessionReplyInterface {
 public:
  // Both outlive it. The numbers of the connection and of its user stand in log lines.
  RemoteClient(const DBusServerServices& services, ConnectionOutput& output, uint64_t connection,
               uint32_t user)
      : services_(services), output_(output), connection_(connection), user_(user) {}

  [[nodiscard]] std::optional<Error> sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                         double timestamp, uint16_t category, uint16_t type,
                                                         std::optional<Dictionary> payload) override;

 private:
  const DBusServerServices& services_;
  ConnectionOutput& output_;
  const uint64_t connection_;
  const uint32_t user_;
};

}  // namespace kyt
