// The log on NATS JetStream. A message is published on the subject kyt.events.PARTITION with its ID in "Nats-Msg-Id", by
// which the stream knows repeats, and with a reply subject of its own below one inbox, INBOX.GROUP.TOKEN, where the stream's
// acknowledgement arrives. Dead letters go to "kyt.dead". That no stream takes a subject the library says of a subscription,
// not of a message: so each group of partitions has a subscription of its own.
//
// Threads: who publishes writes as much as the server takes at once; one of its own ("kyt-log") connects, writes the rest,
// and reads the answers (NatsSocket.h).
#pragma once

#include <nats/nats.h>

#include <atomic>
#include <chrono>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"
#include "receiver/EventLog.h"
#include "receiver/Settings.h"
#include "receiver/nats/NatsSocket.h"
#include "receiver/nats/NatsStreams.h"

namespace kyt::receiver {

class NatsLog final : public EventLog {
 public:
  NatsLog(const LogSettings& settings, Log& lines);  // which outlive this
  ~NatsLog() override;
  NatsLog(const NatsLog&) = delete;
  NatsLog& operator=(const NatsLog&) = delete;

  void start(LogListener& listener) override;
  void publish(uint64_t token, std::shared_ptr<const LogMessage> message) override EXCLUDES(mutex_);
  void publishDeadLetter(std::shared_ptr<const LogMessage> message) override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<uint64_t> maxBodyBytes() const override;
  void stop() override EXCLUDES(mutex_);

  // See NatsStreams.h. Blocks; without start().
  [[nodiscard]] StreamsMade makeStreams(bool updates);

 private:
  static constexpr char kDead[] = "dead", kAsk[] = "ask";
  static constexpr uint64_t kUnknown = ~uint64_t{0};
  // A write that the server does not take ends the connection, and another server is tried.
  static constexpr std::chrono::milliseconds kWriteTime{1500};
  struct Item {
    uint64_t token = 0;  // 0: a dead letter
    std::shared_ptr<const LogMessage> message;
  };
  struct Free {
    void operator()(natsOptions* options) const { natsOptions_Destroy(options); }
    void operator()(natsConnection* connection) const { natsConnection_Destroy(connection); }
    void operator()(natsSubscription* subscription) const { natsSubscription_Destroy(subscription); }
    void operator()(natsMsg* message) const { natsMsg_Destroy(message); }
    void operator()(jsCtx* context) const { jsCtx_Destroy(context); }
    void operator()(natsInbox* inbox) const { natsInbox_Destroy(inbox); }
  };
  template <typename T>
  using Owned = std::unique_ptr<T, Free>;

  [[nodiscard]] natsStatus makeOptions(Owned<natsOptions>& options);
  static void onUp(natsConnection* connection, void* self);
  static void onDown(natsConnection* connection, void* self);
  static void onClosed(natsConnection* connection, void* self);
  void run() EXCLUDES(mutex_);
  [[nodiscard]] Duration timeToWait() EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Item> takeItem() EXCLUDES(mutex_);
  void writeQueue() EXCLUDES(mutex_);
  [[nodiscard]] uint32_t groups() const;
  void takeAnswers();
  [[nodiscard]] bool takeNext(size_t subscription);
  void take(size_t subscription, natsMsg* message);
  void tellNobodyTakes(size_t subscription, uint64_t messages);
  [[nodiscard]] bool connect();
  [[nodiscard]] natsStatus subscribe(natsConnection* connection);
  void noteConnected(natsConnection* connection);
  [[nodiscard]] bool isStopping() EXCLUDES(mutex_);
  void writeOrQueue(Item item) EXCLUDES(mutex_);
  void write(const Item& item);
  [[nodiscard]] natsStatus publish(const Item& item);
  void ask(const std::string& subject, const char* what, const std::string& request);
  void takeStreamNames(std::string_view json);
  void takeStreamInfo(std::string_view json);
  void takeAcknowledgement(uint64_t token, natsMsg* message);
  void endDeadLetter(bool isStored);
  void setUp(bool isUp) EXCLUDES(upMutex_);

  const LogSettings& settings_;
  Log& lines_;
  LogListener* listener_ = nullptr;
  std::string inbox_;
  NatsSocket socket_;
  Owned<natsConnection> connection_;
  std::vector<Owned<natsSubscription>> subscriptions_;  // of the groups, then kDead, then kAsk
  std::vector<Owned<natsMsg>> read_;                    // and answered; the thread's alone
  std::atomic<uint64_t> maxBodyBytes_{kUnknown};
  std::atomic<uint64_t> deadInFlight_{0};  // dead letters without an answer
  std::atomic<bool> isConnected_{false}, hasStream_{false};
  std::string toldProblem_;  // of connecting, told last; the thread's alone
  std::atomic<bool> isMissingTold_{false}, isRetentionTold_{false}, mustAskRetention_{false},
      isTooSmall_{false}, mustAskStream_{true};
  std::thread thread_;

  Mutex upMutex_;  // held while the listener is told, so that it is told in order
  bool isUp_ GUARDED_BY(upMutex_) = false;
  bool isEnding_ GUARDED_BY(upMutex_) = false;

  Mutex mutex_;
  ConditionVariable changed_;
  std::deque<Item> queue_ GUARDED_BY(mutex_);  // while the server does not take what was written
  uint64_t writers_ GUARDED_BY(mutex_) = 0;    // threads in write()
  bool isClosed_ GUARDED_BY(mutex_) = true;    // the library's connection: it calls back no more
  bool isStopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace kyt::receiver
