// One client's connection: the real Connection, over a Stream.
//
// It belongs to its serial queue (owner: the peer's user and one). The reactor reports once that there is
// something to read; then a turn on the queue reads large blocks into a lent buffer, handles each call,
// gathers the replies for one write and asks the reactor again. A turn ends after 256 calls, 1 MiB or 0.2
// milliseconds and stands in line again. What follows the last whole message is kept until more comes; an idle connection
// keeps nothing.
//
// The end has one road: the session's handlers run, what waits is written, the watch ends, the descriptor is
// closed, the table forgets the connection.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/Reactor.h"
#include "platform/base/Counters.h"
#include "platform/base/Mutex.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/ConnectionOutput.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/Listener.h"
#include "platform/ipc/MessageReader.h"
#include "platform/ipc/ServerContext.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/Timer.h"

namespace kyt {

class DBusConnection final : public Connection,
                             private ClientSessionReplyInterface,
                             private ConnectionOutput::Observer,
                             public std::enable_shared_from_this<DBusConnection> {
 public:
  DBusConnection(std::shared_ptr<ServerContext> context, std::unique_ptr<Stream> stream, PeerCredentials peer,
                 std::shared_ptr<UserAccount> account, uint64_t number);
  ~DBusConnection() override;

  // Asks the delegate, on the queue; starts, or closes at once.
  void offer(Listener& listener, ListenerDelegate& delegate);
  // The server is going: no handler runs any more, nothing is written.
  void abandon();

  [[nodiscard]] Value entitlementValue(std::string_view key) override;
  [[nodiscard]] std::string description() const override;
  [[nodiscard]] uint32_t peerUser() const override { return user_; }
  [[nodiscard]] std::shared_ptr<UserAccount> userAccount() const override { return account_; }
  void setExportedObject(std::shared_ptr<ClientSessionInterface> object) override;
  void setInterruptionHandler(Task handler) override;
  void setInvalidationHandler(Task handler) override;
  void resume() override;
  void invalidate() override;
  void finish() override;
  [[nodiscard]] ClientSessionReplyInterface& remoteObjectProxy() override { return *this; }
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
  };

  // Those that require the queue are its work, or steps of it.
  void turn() REQUIRES(*queue_);
  void countCall(Progress& progress) const;
  Step runSteps(Progress& progress) REQUIRES(*queue_);
  Step step(std::span<std::byte> buffer, Progress& progress) REQUIRES(*queue_);
  Step readMore(std::span<std::byte> buffer, size_t& bytes) REQUIRES(*queue_);
  Step handleBytes(std::span<const std::byte> bytes, size_t& consumed, Progress& progress) REQUIRES(*queue_);
  Step handleHandshake(std::span<const std::byte> bytes, size_t& consumed) REQUIRES(*queue_);
  Step handleMessage(std::span<const std::byte> bytes, size_t& consumed, HeaderMemory& header)
      REQUIRES(*queue_);
  Step takeDescriptors(const Message& message, std::vector<Descriptor>& taken) REQUIRES(*queue_);
  [[nodiscard]] bool mustPause() const;
  Step keepRest(std::span<const std::byte> rest) REQUIRES(*queue_);
  Step tooManyBytes() REQUIRES(*queue_);
  void watchBegunMessage() REQUIRES(*queue_);
  void messageTookTooLong() REQUIRES(*queue_);
  Step breakOff(Reason reason, const char* problem) REQUIRES(*queue_);
  [[nodiscard]] std::string descriptionOnQueue() const REQUIRES(*queue_);

  void countRefusal() REQUIRES(*queue_);
  void start() REQUIRES(*queue_);
  void handshakeTookTooLong() REQUIRES(*queue_);
  void end(bool broken, bool waitForOutput) REQUIRES(*queue_);
  void endLater(bool broken);
  void closeStream() REQUIRES(*queue_);
  [[nodiscard]] bool closed() const { return closed_; }
  void scheduleTurn();
  void armRead();
  void armWatch(unsigned events);
  void handleReady(unsigned events);

  void outputNeedsRoom() override;
  void outputPaused() override;
  void outputDrained() override;
  void outputOverflowed() override;
  void outputBroken() override;

  [[nodiscard]] std::optional<Error> sendMessageToClient(std::optional<Dictionary> sessionInfo,
                                                         double timestamp, uint16_t category, uint16_t type,
                                                         std::optional<Dictionary> payload) override;

  // Constant.
  const std::shared_ptr<ServerContext> context_;
  const uint64_t number_;
  const uint32_t user_;
  const int32_t process_;
  const int descriptor_;  // the stream's
  const std::shared_ptr<UserAccount> account_;
  const std::shared_ptr<SerialQueue> queue_;

  // Synchronises itself.
  std::shared_ptr<ConnectionOutput> output_;
  std::atomic<bool> invalidating_{false};  // stop handling calls
  std::atomic<bool> finishing_{false};     // stop reading
  std::atomic<bool> hurried_{false};       // do not wait for what is queued to be written
  std::atomic<bool> peerGone_{false};      // the reactor saw the end of the client's side
  std::atomic<bool> turnScheduled_{false};

  // Until it is resumed, who the client is.
  std::unique_ptr<PeerCredentials> peer_ GUARDED_BY(*queue_);
  std::unique_ptr<Stream> stream_ GUARDED_BY(*queue_);
  std::unique_ptr<ServerHandshake> handshake_ GUARDED_BY(*queue_);
  TimerHandle handshakeTimer_ GUARDED_BY(*queue_);
  std::shared_ptr<ClientSessionInterface> exportedObject_ GUARDED_BY(*queue_);
  Task interruptionHandler_ GUARDED_BY(*queue_), invalidationHandler_ GUARDED_BY(*queue_);
  // The beginning of a message, or messages that the last turn left; and how much it must hold before it is worth
  // looking at.
  std::string kept_ GUARDED_BY(*queue_);
  size_t needed_ GUARDED_BY(*queue_) = 0;
  std::vector<Descriptor> descriptors_ GUARDED_BY(*queue_);
  Charge keptCharge_ GUARDED_BY(*queue_), descriptorsCharge_ GUARDED_BY(*queue_);  // for these
  // While a message is unfinished, and a little longer.
  TimerHandle messageTimer_ GUARDED_BY(*queue_);
  bool messageTimed_ GUARDED_BY(*queue_) = false;
  // Handled by now, and when the timer was set.
  uint64_t messages_ GUARDED_BY(*queue_) = 0, timedMessages_ GUARDED_BY(*queue_) = 0;
  bool descriptorsAgreed_ GUARDED_BY(*queue_) = false;
  bool refused_ GUARDED_BY(*queue_) = false;  // what was asked for was not granted
  bool resumed_ GUARDED_BY(*queue_) = false, started_ GUARDED_BY(*queue_) = false;
  bool ended_ GUARDED_BY(*queue_) = false;

  // The queue, the reactor's thread and writers arm the watch. The mutex is held over the system call; the handler does
  // without it, since what was armed may be ready at once.
  Mutex watchMutex_;
  Watch watch_ GUARDED_BY(watchMutex_);
  std::atomic<unsigned> armed_{0};
  std::atomic<bool> closed_{false};  // set under the mutex
};

}  // namespace kyt
