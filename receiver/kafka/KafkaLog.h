// The log on Kafka's protocol, by librdkafka. A message goes to the topic that is the stream's name, into its partition, with
// its ID as key; dead letters go to "kyt-dead-letters". Kafka knows no repeats of posts, so whoever reads removes them, by
// their IDs. Tested against the library's mock cluster, and against no broker.
//
// Threads: one of its own ("kyt-kafka") takes the library's answers.
#pragma once

#include <librdkafka/rdkafka.h>

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "platform/base/Mutex.h"
#include "platform/queues/Log.h"
#include "receiver/EventLog.h"
#include "receiver/Settings.h"

namespace kyt::receiver {

class KafkaLog final : public EventLog {
 public:
  KafkaLog(const LogSettings& settings, Log& lines);  // which outlive this
  ~KafkaLog() override;
  KafkaLog(const KafkaLog&) = delete;
  KafkaLog& operator=(const KafkaLog&) = delete;

  // Before start(): what is wrong with the library's settings, or none.
  [[nodiscard]] std::optional<std::string> open();
  void start(LogListener& listener) override;
  void publish(uint64_t token, std::shared_ptr<const LogMessage> message) override;
  void publishDeadLetter(std::shared_ptr<const LogMessage> message) override;
  [[nodiscard]] std::optional<uint64_t> maxBodyBytes() const override;
  void stop() override;

 private:
  struct Free {
    void operator()(rd_kafka_t* client) const { rd_kafka_destroy(client); }
  };

  static void onDelivery(rd_kafka_t* client, const rd_kafka_message_t* message, void* self);
  static void onError(rd_kafka_t* client, int error, const char* reason, void* self);
  static void onLine(const rd_kafka_t* client, int level, const char* facility, const char* text);
  [[nodiscard]] rd_kafka_resp_err_t produce(const char* topic, int32_t partition, uint64_t token,
                                            const LogMessage& message);
  void run();
  void look();
  void setUp(bool isUp) EXCLUDES(upMutex_);

  const LogSettings& settings_;
  Log& lines_;
  LogListener* listener_ = nullptr;
  std::unique_ptr<rd_kafka_t, Free> client_;
  std::atomic<bool> isStopping_{false}, isThere_{false};
  bool isMissingTold_ = false;  // the thread's alone
  std::thread thread_;

  Mutex upMutex_;  // held while the listener is told, so that it is told in order
  bool isUp_ GUARDED_BY(upMutex_) = false;
};

}  // namespace kyt::receiver
