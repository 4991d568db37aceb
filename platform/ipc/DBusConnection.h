// One client's connection: the real Connection, over a Stream.
//
// It belongs to its serial queue (owner: the peer's user and one). The reactor reports once that there is
// something to read; then a turn on the queue reads large blocks into a lent buffer, handles each call,
// gathers the replies for one write and asks the reactor again. A turn ends after 256 calls, 1 MiB or 0.2
// milliseconds and stands in line again. What follows the last whole message is kept until more comes; an idle connection
// keeps nothing.
//
// Its life goes one way (ConnectionLife), and the end has one road: the session's handlers run, what waits is written, the
// watch ends, the descriptor is closed, the table forgets the connection.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/Admission.h"
#include "platform/ipc/ConnectionLife.h"
#include "platform/ipc/ConnectionOutput.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/KeptBytes.h"
#include "platform/ipc/Listener.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/Patience.h"
#include "platform/ipc/ReceivedDescriptors.h"
#include "platform/ipc/RemoteClient.h"
#include "platform/ipc/ServerContext.h"
#include "platform/ipc/SocketWatch.h"
#include "platform/queues/LineOrder.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

class DBusConnection final : public Connection,
                             private ConnectionOutput::Observer,
                             public std::enable_shared_from_this<DBusConnection> {
 public:
  DBusConnection(std::shared_ptr<ServerContext> context, std::unique_ptr<Stream> stream, PeerCredentials peer,
                 std::shared_ptr<UserAccount> account, uint64_t number);

  // Enters the server's table, and asks the delegate, on the queue; starts, or closes at once. Called once, first.
  void offer(Listener& listener, ListenerDelegate& delegate);
  // The server is going: no handler runs any more, nothing is written. False when it was closed already.
  bool abandon();

  [[nodiscard]] Value entitlementValue(std::string_view key) override;
  [[nodiscard]] std::string description() const override;
  [[nodiscard]] uint32_t peerUser() const override { return user_; }
  [[nodiscard]] int32_t peerProcess() const override { return process_; }
  [[nodiscard]] bool isPeerInGroup(uint32_t group) const override;
  [[nodiscard]] std::shared_ptr<UserAccount> userAccount() const override { return account_; }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  void setInterruptionHandler(Task handler) override;
  void setInvalidationHandler(Task handler) override;
  void resume() override;
  void invalidate() override;
  void finish() override;
  [[nodiscard]] ClientSessionReplyInterface& remoteObjectProxy() override { return client_; }
  [[nodiscard]] const std::shared_ptr<SerialQueue>& queue() const override { return queue_; }

 private:
  // How a turn's piece of work ended.
  enum class Step : uint8_t {
    more,     // there is more to do at once
    drained,  // the socket has no more: the reactor will say when it has
    paused,   // the client does not read its replies
    ended,    // the client ended the stream in good order
    broken,   // the stream broke, or the client broke the protocol
    stopped   // this side ends the connection
  };
  struct Progress {
    MonotonicTime begin;
    unsigned calls = 0;
    size_t bytes = 0;
    bool over = false;  // the turn has had its share
    HeaderMemory header;
    void countCall(const Clock& clock);
  };

  // Those that require the queue are its work, or steps of it.
  void turn() REQUIRES(*queue_);
  Step runSteps(Progress& progress) REQUIRES(*queue_);
  Step step(std::span<std::byte> buffer, Progress& progress) REQUIRES(*queue_);
  Step readMore(std::span<std::byte> buffer, size_t& bytes) REQUIRES(*queue_);
  Step handleBytes(std::span<const std::byte> bytes, size_t& consumed, Progress& progress) REQUIRES(*queue_);
  Step handleHandshake(std::span<const std::byte> bytes, size_t& consumed) REQUIRES(*queue_);
  Step handleMessage(std::span<const std::byte> bytes, size_t& consumed, HeaderMemory& header)
      REQUIRES(*queue_);
  [[nodiscard]] bool mustPause() const;
  void watchBegunMessage() REQUIRES(*queue_);
  void messageTookTooLong() REQUIRES(*queue_);
  Step breakOff(Reason reason, const char* problem) REQUIRES(*queue_);

  void decide(Listener& listener, ListenerDelegate& delegate) REQUIRES(*queue_);
  void start() REQUIRES(*queue_);
  void handshakeTookTooLong() REQUIRES(*queue_);
  void end(Step how) REQUIRES(*queue_);
  void endLater(Step how);
  void closeStream() REQUIRES(*queue_);
  void scheduleTurn();
  void armWatch(unsigned events);
  void handleReady(unsigned events);

  void outputNeedsRoom() override;
  void outputPaused() override;
  void outputDrained() override;
  void outputOverflowed() override;
  void outputBroken() override;

  // Constant.
  const std::shared_ptr<ServerContext> context_;
  const uint64_t number_;
  const uint32_t user_;
  const int32_t process_;
  const std::shared_ptr<UserAccount> account_;
  const std::shared_ptr<SerialQueue> queue_;
  const std::shared_ptr<ConnectionOutput> output_;

  // Synchronises itself.
  ConnectionLife life_;
  RemoteClient client_;
  SocketWatch watch_;
  // Nobody waits for what is queued to be written: the connection was invalidated, or the client has ended its side.
  std::atomic<bool> hurried_{false};
  std::atomic<bool> turnScheduled_{false};

  std::unique_ptr<Admission> admission_ GUARDED_BY(*queue_);  // until the delegate has decided
  std::unique_ptr<Stream> stream_ GUARDED_BY(*queue_);
  std::unique_ptr<ServerHandshake> handshake_ GUARDED_BY(*queue_);  // until it is done
  TimerHandle handshakeTimer_ GUARDED_BY(*queue_);
  std::shared_ptr<ExportedObject> exportedObject_ GUARDED_BY(*queue_);
  Task interruptionHandler_ GUARDED_BY(*queue_), invalidationHandler_ GUARDED_BY(*queue_);
  KeptBytes kept_ GUARDED_BY(*queue_);
  ReceivedDescriptors descriptors_ GUARDED_BY(*queue_);
  Patience patience_ GUARDED_BY(*queue_);
  LineOrder lines_ GUARDED_BY(*queue_);
};

}  // namespace kyt
