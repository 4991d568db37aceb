// One connection of the fake daemon: notes what its program calls, and answers as the real daemon would where all is well.
// Called on the connection's queue.
#pragma once

#include <initializer_list>
#include <memory>
#include <optional>
#include <utility>

#include "platform/ipc/ClientSessionInterface.h"
#include "testing/Aggregators.h"
#include "testing/Records.h"

namespace kyt::testing {

class FakeSession final : public ClientSessionInterface {
 public:
  // What configurations bring: names of back ends, or none.
  FakeSession(uint64_t number, std::weak_ptr<Connection> connection, std::shared_ptr<Records> records,
              std::shared_ptr<Aggregators> aggregators, std::optional<Array> states)
      : number_(number),
        connection_(std::move(connection)),
        records_(std::move(records)),
        aggregators_(std::move(aggregators)),
        states_(std::move(states)) {}

  void setSessionInfo(Dictionary info, std::optional<Dictionary> user, Value frameworks,
                      bool aggregates) override;
  void startConfigWithCompletionHandler(StatesReply reply) override;
  void fetchStatesWithUserInfo(std::optional<Dictionary> user, StatesReply reply) override;
  void fetchDisplayURL(StringReply reply) override;
  void sendMessageWithDictionary(Dictionary message, ObjectReply reply) override;
  void flushMessagesWithCompletion(ResultReply completion) override;
  void finishSessionGracefully() override;
  void uploadFileAtPath(String url, String token, std::optional<FileExtension> extension,
                        SuccessReply reply) override;
  void uploadLogData(Value data, SuccessErrorReply reply) override;
  void sendMessageWithSessionInfo(Dictionary info, std::optional<Dictionary> user, uint16_t category,
                                  uint16_t type, std::optional<Dictionary> payload,
                                  StringReply reply) override;
  void updateSharedDataWithDictionary(Dictionary data) override;
  void updateSharedDataForKey(String key, Value value) override;
  void setDigestKey(Data key, int32_t algorithm) override;

 private:
  [[nodiscard]] Event event(Kind kind) const;
  [[nodiscard]] bool hasStorebag(const Dictionary& info) const;
  // One of these is live.
  [[nodiscard]] bool has(std::initializer_list<const char*> backEnds) const;
  [[nodiscard]] bool takesUploads() const;  // one of the back ends is for files and log data
  [[nodiscard]] bool keepsBatches() const;  // one of them can be flushed
  // False: the daemon is dead.
  bool note(Event event) const { return records_->add(std::move(event)); }
  // Of a dead daemon: an answer that is dropped would be an error, so it is kept until the connection is gone.
  template <typename Reply>
  void keep(Reply reply) {
    records_->keepAnswer([kept = std::move(reply)] {});
  }

  const uint64_t number_;
  const std::weak_ptr<Connection> connection_;      // which holds this
  const std::shared_ptr<Records> records_;          // with the other connections, and the daemon
  const std::shared_ptr<Aggregators> aggregators_;  // likewise
  const std::optional<Array> states_;
  bool hasStorebag_ = false;   // its client type has one
  bool isConfigured_ = false;  // it has back ends
  bool batches_ = false;
  bool pending_ = false;  // messages were batched since the last flush
};

}  // namespace kyt::testing
