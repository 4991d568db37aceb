// The back end that posts events as JSON over HTTPS. Each event becomes one flat record; depending on the
// back end's state and the message's flag the record is dropped, batched or posted at once. The storebag's
// entry for the client decides the state, the addresses, the filters and the limits. Made by the factory,
// owned by one session.
//
// This is the face, whose operations are a contract and therefore many; the work is done by RecordMaker (an event's
// record), ClientRules (what the storebag decides: a Decision), EventBatch (the records that wait), PostRequest (the
// message and its request), PostReply (what the answer means), and PostLine (large batches are posted beside the session's
// queue).
//
// Threads: called on its session's queue. `setCorrelatedSessionID`, `batchedEventsSize` and the properties
// that the base keeps on the state queue may be called from any thread, as other sessions and the health
// report do. Replies arrive on the URL session's queue and hold this object weakly: one that finds it gone
// changes nothing but still calls its completion. Completions of a flush run on the caller's thread, or on
// the URL session's queue, never on the state queue.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "backend/KYTReportingBackend.h"
#include "backends/https/ClientRules.h"
#include "backends/https/Decision.h"
#include "backends/https/EventBatch.h"
#include "backends/https/OutgoingPost.h"
#include "backends/https/PostLine.h"
#include "backends/https/PostRequest.h"
#include "backends/https/RecordMaker.h"
#include "config/Configuration.h"

namespace kyt {

class HTTPSPostBackend : public KYTReportingBackend {
 public:
  // Null without a name or a profile, and when the profile has no list of clients.
  static std::shared_ptr<HTTPSPostBackend> initWithName(Configuration& configuration,
                                                        const std::optional<String>& name,
                                                        const std::optional<Dictionary>& profile,
                                                        SharedSessionFacts facts);
  HTTPSPostBackend(Making, Configuration& configuration, String name, Dictionary profile,
                   SharedSessionFacts facts);
  ~HTTPSPostBackend() override;

  // When it returns everything that was to be posted has been handed to the poster.
  void cleanup() override;
  using KYTReportingBackend::sendMessage;
  Value sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    EventID eventID, MessageFlag flag) override;
  void updateState() override;
  Value flushMessagesWithCompletion(FlushCompletion completion) override;
  // Writes it into every record of the batch too.
  void setCorrelatedSessionID(const SessionIDPath& sessionID) override;
  [[nodiscard]] uint64_t batchedEventsSize() override;

  // The record of one event: a copy of the payload, and the fixed keys over it. `eventID` is ignored.
  [[nodiscard]] Dictionary newEventDictfromPayload(Dictionary payload, const TimeValue& timestamp,
                                                   uint16_t method, uint16_t respCode, EventID eventID) const;
  // Merges the user information, then `frameworkData` (which may be null), each over what is there.
  void mergeInformation(Dictionary& event, const Dictionary* frameworkData) const;
  // The same, then filters.
  void prepareEventForMessage(Dictionary& event, const Dictionary* frameworkData) const;

  // Whether "post_url" was taken from this client entry.
  bool updatePostLink(const Dictionary& client) { return rules_.updatePostLink(decision_, client); }
  [[nodiscard]] bool matchClientNameAndServiceID(const Dictionary& client, const String* clientName,
                                                 const String* serviceID) const {
    return ClientRules::matchClientNameAndServiceID(client, clientName, serviceID);
  }
  void resetBackendStateWithClient(const Dictionary* client) {
    rules_.resetBackendStateWithClient(decision_, client);
  }
  [[nodiscard]] bool isFrameworkEnabledForClient(const Dictionary& client) const {
    return rules_.isFrameworkEnabledForClient(client);
  }
  [[nodiscard]] int32_t updateBackendState();
  void createFiltersFromArray(const Array& filters) { decision_.filters.createFiltersFromArray(filters); }
  void filterEvent(Dictionary& event) const;

  // The text of a flush that the record's method forced, or nothing.
  Value batchEvent(Dictionary record);
  // The request body. `prettyJSONString`, when given, receives the pretty text where that may be shown, else
  // null; `events`, when given, how many of the records are in the body: all, or none without a client ID.
  [[nodiscard]] std::optional<std::string> createMessageForPostAndLogging(Array records,
                                                                          Value* prettyJSONString,
                                                                          size_t* events = nullptr);
  // The completion gets (nothing, error or nothing); it is never called without a connectivity delegate.
  // `events` are those that are lost with the message.
  void postJSONMessage(std::string json, MessageFlag flag, std::optional<uint16_t> method,
                       std::optional<uint16_t> responseCode, FlushCompletion completion,
                       BookedEvents events = BookedEvents::unbooked(1));

  // Is told the rules of later decisions. Null, as at first: nobody. It outlives the back end.
  void setRuleWitness(RuleWitness* witness) { rules_.setWitness(witness); }
  [[nodiscard]] const std::optional<String>& postURL() const { return decision_.postURL; }
  void setPostURL(std::optional<String> value) { decision_.postURL = std::move(value); }
  [[nodiscard]] const std::optional<String>& realtimePostURL() const { return decision_.realtimePostURL; }
  [[nodiscard]] int32_t numberOfFilters() const { return decision_.filters.numberOfFilters(); }
  [[nodiscard]] int32_t eventThreshold() const { return decision_.eventThreshold; }
  [[nodiscard]] int32_t dnuType() const { return decision_.dnuType; }
  [[nodiscard]] bool shouldUseWiFiOnly() const { return decision_.shouldUseWiFiOnly; }
  [[nodiscard]] bool immutable() const { return immutable_; }

 private:
  enum class TextOf { flush, flushAndEvent };
  enum class BatchTaking { nothing, discarded, userInfoMissing, taken };
  struct Device {             // what the device says when the back end is made
    bool dnuEnabled = false;  // the user's consent to diagnostics-and-usage upload
    bool forceEventLogging = false;
    String uuidRespectDnu, uuidOverrideDnu;
  };

  [[nodiscard]] Device readDevice();
  [[nodiscard]] const Dictionary* userInfo() const { return userInfoDict() ? &*userInfoDict() : nullptr; }
  [[nodiscard]] bool lacksUserInfo() const;
  void addStopEntries(Dictionary& payload) const;
  [[nodiscard]] PostRequest::Message makeMessage(const PostRequest& post, Array records);
  // None without an address, which the completion has been told.
  [[nodiscard]] std::optional<OutgoingPost> newPost(MessageFlag flag, std::optional<uint16_t> method,
                                                    std::optional<uint16_t> responseCode,
                                                    FlushCompletion completion, BookedEvents events);
  Value sendStandalone(Dictionary record, int32_t state, uint16_t method, uint16_t respCode,
                       MessageFlag flag);

  // The batch.
  // The text of the flush alone is made where somebody wants it, that of one that goes before an event always.
  Value flush(FlushCompletion completion, TextOf text);
  // `bytes` are what the records count with the user.
  Value postBatch(EventBatch::Taken batch, uint64_t bytes, FlushCompletion completion, TextOf text);
  void postBeside(PostRequest::Message message, BookedEvents events, uint64_t bytes);
  [[nodiscard]] bool takesRoomFor(uint64_t batched, uint64_t bytes);
  void giveBackToUser(uint64_t bytes) const;
  void tellDroppedByLimit() const;
  void tellDroppedByUser() const;
  [[nodiscard]] BatchTaking takeBatchOnQueue(EventBatch::Taken& batch) REQUIRES(stateQueue());
  void tellDiscarded(size_t events, const char* why) const;
  [[nodiscard]] bool admits(const Dictionary& record) const;
  [[nodiscard]] EventBatch::Taken recordsToPost(EventBatch::Taken batch) const;
  // Of a record; a filter may have taken the numbers away.
  [[nodiscard]] static EventKind kindOf(const Dictionary& record);
  // Lets watchers, where there are any, be told what becomes of these events, which have those records. `dropped`: of those
  // that are dropped at once; none: of those that are posted.
  void showFate(BookedEvents& events, const Array& records, std::optional<Reason> dropped) const;
  [[nodiscard]] BookedEvents carried(BookedEvents events, size_t inMessage) const;

  [[nodiscard]] PostFacts postFacts() const;

  const Configuration configuration_;
  const RecordMaker records_;

  // The session's queue.
  Decision decision_;
  const Device device_;
  ClientRules rules_;
  bool immutable_ = false;   // once set, the state is no longer decided anew
  size_t jsonSizeHint_ = 0;  // size of the last message
  PostLine line_;

  EventBatch batch_ GUARDED_BY(stateQueue());
};

}  // namespace kyt
