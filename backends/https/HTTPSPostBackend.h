// The back end that posts events as JSON over HTTPS. Each event becomes one flat record; depending on the
// back end's state and the message's flag the record is dropped, batched or posted at once. The storebag's
// entry for the client decides the state, the addresses, the filters and the limits. Made by the factory,
// owned by one session.
//
// The class is told in five files: HTTPSPostBackend.cpp (its making, and the road of one event), …Record.cpp
// (an event's record), …State.cpp (what the storebag decides), …Batch.cpp (the batch and its flush),
// …Post.cpp (the message and its request).
//
// Threads: called on its session's queue. `setCorrelatedSessionID`, `batchedEventsSize` and the properties
// that the base keeps on the state queue may be called from any thread, as other sessions and the health
// report do. Replies arrive on the URL session's queue and hold this object weakly: one that finds it gone
// changes nothing but still calls its completion. Completions of a flush run on the caller's thread, or on
// the URL session's queue, never on the state queue.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "backend/KYTReportingBackend.h"
#include "backends/https/EventFilters.h"
#include "config/Configuration.h"
#include "platform/base/Counters.h"

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
  // Merges the user information, then `frameworkData` (which may be null), each over what is there, then
  // filters.
  void prepareEventForMessage(Dictionary& event, const Dictionary* frameworkData) const;

  // Whether "post_url" was taken from this client entry.
  bool updatePostLink(const Dictionary& client);
  [[nodiscard]] bool matchClientNameAndServiceID(const Dictionary& client, const String* clientName,
                                                 const String* serviceID) const;
  void resetBackendStateWithClient(const Dictionary* client);
  [[nodiscard]] bool isFrameworkEnabledForClient(const Dictionary& client) const;
  [[nodiscard]] int32_t updateBackendState();
  void createFiltersFromArray(const Array& filters) { filters_.createFiltersFromArray(filters); }
  void filterEvent(Dictionary& event) const;

  // The text of a flush that the record's method forced, or nothing.
  Value batchEvent(Dictionary record);
  // The request body. `prettyJSONString`, when given, receives the pretty text where that may be shown, else
  // null; `events`, when given, how many of the records are in the body: all, or none without a client ID.
  [[nodiscard]] std::optional<std::string> createMessageForPostAndLogging(Array records,
                                                                          Value* prettyJSONString,
                                                                          size_t* events = nullptr);
  // The completion gets (nothing, error or nothing); it is never called without a connectivity delegate.
  // `events` is how many are lost with the message.
  void postJSONMessage(std::string json, MessageFlag flag, std::optional<uint16_t> method,
                       std::optional<uint16_t> responseCode, FlushCompletion completion, size_t events = 1);

  [[nodiscard]] const std::optional<String>& postURL() const { return postURL_; }
  void setPostURL(std::optional<String> value) { postURL_ = std::move(value); }
  [[nodiscard]] const std::optional<String>& realtimePostURL() const { return realtimePostURL_; }
  [[nodiscard]] int32_t numberOfFilters() const { return filters_.numberOfFilters(); }
  [[nodiscard]] int32_t eventThreshold() const { return eventThreshold_; }
  [[nodiscard]] int32_t dnuType() const { return dnuType_; }
  [[nodiscard]] bool shouldUseWiFiOnly() const { return shouldUseWiFiOnly_; }
  [[nodiscard]] bool immutable() const { return immutable_; }

 private:
  enum class BatchTaking { nothing, discarded, userInfoMissing, taken };
  struct Shared {  // what other sessions may change
    int32_t state = kBackendStateUndecided;
    std::optional<SessionIDPath> sessionID;
  };
  struct Client {  // what the user information calls the client, null where it does not
    const String* name = nullptr;
    const String* service = nullptr;
  };

  void readUserDefaults();
  [[nodiscard]] bool hasUserInfo() const { return userInfoDict() && !userInfoDict()->empty(); }
  [[nodiscard]] const String* userInfoText(const char* key) const;

  // The road of one event.
  [[nodiscard]] Dictionary takePayload(Dictionary& message) const;
  // `room` is how many more entries the caller is going to merge.
  [[nodiscard]] Dictionary makeRecord(Dictionary payload, const TimeValue& timestamp, uint16_t method,
                                      uint16_t respCode, const std::optional<String>& sessionID,
                                      size_t room) const;
  void addStopEntries(Dictionary& payload) const;
  Value sendStandalone(Dictionary record, int32_t state, uint16_t method, uint16_t respCode,
                       MessageFlag flag);

  // The decision.
  void applyExpedite(const Array& clients, const Client& client);
  [[nodiscard]] int32_t enableWithoutUserInfo(const Array& clients);
  [[nodiscard]] const Dictionary* chosenEntry(const Array& clients, const Client& client) const;
  // Whether consent, country, device and filters let the chosen entry report.
  [[nodiscard]] bool passesRules(const Dictionary& entry, const String* country);
  [[nodiscard]] bool passesConsent(const Dictionary& entry);
  [[nodiscard]] bool passesLists(const Dictionary& entry, const String* country) const;
  void tellDiscarded(size_t events, const char* why) const;
  [[nodiscard]] int32_t decideBySampling(const Dictionary& entry, const String* country);
  void tellWhyNot(Reason reason, const char* why) const;
  void takeSettings(const Dictionary& entry, const Client& client, int32_t state);
  [[nodiscard]] String getPersistentIdentifierForCustomClientIDSuffix(const Client& client);

  // The batch. Those that say so run on the state queue.
  [[nodiscard]] int32_t countOnQueue(int32_t method) const;
  void forgetSizesOnQueue();
  void appendOnQueue(Dictionary record, int32_t method, int32_t count, uint64_t bytes);
  void countDroppedByLimit() const;
  void writeSessionIDOnQueue();
  [[nodiscard]] bool takeFromUser(uint64_t bytes) const;
  void giveBackToUser(uint64_t bytes) const;
  void countDroppedByUser() const;
  [[nodiscard]] BatchTaking takeBatchOnQueue(Array& records, uint64_t& bytes);
  [[nodiscard]] bool admits(const Dictionary& record) const;
  [[nodiscard]] Array recordsToPost(Array batch, uint64_t bytes) const;

  // The message and its request.
  void removeUnpostable(Dictionary& record) const;
  [[nodiscard]] std::optional<String> clientID() const;
  [[nodiscard]] bool mayShowPrettyText() const;
  [[nodiscard]] std::string addressWithForcedScheme(const String& url) const;
  [[nodiscard]] URLRequest newRequest(std::string url, std::string json, std::optional<uint16_t> method,
                                      std::optional<uint16_t> responseCode) const;
  [[nodiscard]] std::string digestOfBody(const Data& body) const;
  [[nodiscard]] std::string versionSuffix() const;
  [[nodiscard]] String formattedReportVersion() const;

  const Configuration configuration_;
  const String reportVersion_;  // as records show it

  // Constant after initWithName.
  bool dnuEnabled_ = false;  // the user's consent to diagnostics-and-usage upload
  bool forceEventLogging_ = false;
  String uuidRespectDnu_;
  String uuidOverrideDnu_;

  // The session's queue.
  std::optional<String> postURL_;
  bool useDefaultPostURL_ = false;  // from the user defaults: the storebag does not replace it
  std::optional<String> realtimePostURL_;
  bool useDefaultRealtimePostURL_ = false;
  EventFilters filters_;
  int32_t dnuType_ =
      0;  // 0: the entry respects the consent; 1: overrides it, consent off; 2: overrides it, consent on
  int32_t eventThreshold_ = 49;  // records of one method in a batch; one more than that, plus one, flushes
  int32_t extrasOnInternal_ = 0;
  Value overrideSampling_;  // a number, or null
  std::optional<String> uuidCustom_;
  // The custom identifiers of this object's life by their keys: one that cannot be stored must not change.
  std::vector<std::pair<std::string, String>> madeIdentifiers_;
  bool shouldUseWiFiOnly_ = false;
  bool immutable_ = false;   // once set, the state is no longer decided anew
  size_t jsonSizeHint_ = 0;  // size of the last message

  // The state queue.
  std::optional<Array> batchedEvents_;
  std::vector<std::pair<int32_t, int32_t>> eventMethodCounts_;  // method, records of it in the batch; sorted
  bool batchHasOldSessionID_ = false;  // written into the records when somebody reads them
  uint64_t batchedBytes_ = 0;          // estimate of what the batch holds; its user's account has it
  // The size that the health report shows, of so many records at the beginning of the batch.
  mutable size_t sizedRecords_ = 0;
  mutable uint64_t sizeOfRecords_ = 0;
};

}  // namespace kyt
