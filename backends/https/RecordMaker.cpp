#include "backends/https/RecordMaker.h"

#include <algorithm>
#include <cmath>
#include <iterator>
#include <string_view>
#include <utility>

#include "config/ClientTypes.h"
#include "config/DeviceIdentity.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr size_t kFixedKeys = 16;
constexpr int64_t kSecondsPerMinute = 60;

constexpr int32_t kClientTypeQH = 7;
constexpr int32_t kClientTypeQM = 11;
constexpr int32_t kClientTypeQPRAV = 13;

// Inline strings, made once: the road of one event allocates one block for its record.
struct RecordKeys {
  String startTS{"_startTS"}, sender{"_sender"}, clientVersion{"_clientVersion"}, sessionID{"_sessionID"};
  String eventNumber{"_eventNumber"}, method{"_method"}, status{"_status"}, clientTS{"_clientTS"};
  String eventTime{"eventTime"}, productFamily{"_productFamily"}, productModel{"_productModel"};
  String osVersion{"_osVersion"}, build{"_build"}, internal{"_internal"}, reportVers{"_reportVers"};
  String timezoneOffset{"_timezoneOffset"};
};

const RecordKeys& recordKeys() {
  static const RecordKeys keys;
  return keys;
}

constexpr const String RecordKeys::*kRecordKeys[] = {
    &RecordKeys::startTS,       &RecordKeys::sender,       &RecordKeys::clientVersion,
    &RecordKeys::sessionID,     &RecordKeys::eventNumber,  &RecordKeys::method,
    &RecordKeys::status,        &RecordKeys::clientTS,     &RecordKeys::eventTime,
    &RecordKeys::productFamily, &RecordKeys::productModel, &RecordKeys::osVersion,
    &RecordKeys::build,         &RecordKeys::internal,     &RecordKeys::reportVers,
    &RecordKeys::timezoneOffset};
static_assert(std::size(kRecordKeys) == kFixedKeys);

// All fixed keys begin with an underscore, except "eventTime".
bool mayHoldFixedKey(const Dictionary& payload) {
  for (const DictionaryEntry& entry : payload) {
    const std::string_view key = entry.key.view();
    if (!key.empty() && (key[0] == '_' || key == "eventTime")) return true;
  }
  return false;
}

// Sets entries over a payload, with a look-up only where the payload may hold the key.
class RecordWriter {
 public:
  RecordWriter(Dictionary& record, bool mayReplace) : record_(record), mayReplace_(mayReplace) {}
  template <typename Content>
  void set(const String& key, Content&& value) {
    if (mayReplace_) [[unlikely]] {
      record_.set(key, Value(std::forward<Content>(value)));
    } else {
      record_.append(key, std::forward<Content>(value));
    }
  }
  void setWhenKnown(const String& key, const std::optional<String>& value) {
    if (value) set(key, *value);
  }

 private:
  Dictionary& record_;
  const bool mayReplace_;
};

}  // namespace

bool isRecordKey(std::string_view key) {
  return std::any_of(std::begin(kRecordKeys), std::end(kRecordKeys), [key](const String RecordKeys::*member) {
    return (recordKeys().*member).view() == key;
  });
}

RecordMaker::RecordMaker(const Configuration& configuration, SharedSessionFacts facts)
    : configuration_(configuration),
      facts_(std::move(facts)),
      reportVersion_(formatObjects("%u.%u%@", {unsigned{facts_->selfVersion[0]},
                                               unsigned{facts_->selfVersion[1]}, facts_->versionSuffix()})) {}

Dictionary RecordMaker::takePayload(Dictionary& message) const {
  // The single-message door sends the bare payload.
  if (!message.contains(kKYTReportingMessageBlobClientData)) return message;
  Value clientData = message.take(kKYTReportingMessageBlobClientData);
  if (Dictionary* payload = clientData.mutableDictionary()) return std::move(*payload);
  configuration_.platform.log.error(
      "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil");
  return {};
}

bool RecordMaker::sendsNumber() const {
  const int32_t type = facts_->compType;
  return type == kClientTypeQH || (facts_->isInternal && (type == kClientTypeQM || type == kClientTypeQPRAV));
}

Dictionary RecordMaker::record(Dictionary payload, const Event& event, const std::optional<String>& sessionID,
                               size_t room) const {
  const RecordKeys& keys = recordKeys();
  Platform& platform = configuration_.platform;
  Dictionary record = std::move(payload);
  RecordWriter writer(record, mayHoldFixedKey(record));
  record.reserve(record.size() + kFixedKeys + room);

  const int64_t startTS =
      Value(facts_->startTimeStamp).longLongValue() / kSecondsPerMinute * kSecondsPerMinute;
  writer.set(keys.startTS, startTS);
  writer.set(keys.sender, clientTypeShortCode(facts_->compType));
  writer.set(keys.clientVersion, static_cast<unsigned>(facts_->clientVersion));
  if (sendsNumber()) {
    writer.set(keys.sessionID, facts_->sessionID);
  } else {
    writer.setWhenKnown(keys.sessionID, sessionID);
  }
  writer.set(keys.eventNumber, static_cast<unsigned>(event.number));
  writer.set(keys.method, static_cast<unsigned>(event.method));
  writer.set(keys.status, static_cast<unsigned>(event.respCode));
  // The offset is added to the start cut to its minute, deliberately: records tell the session's course, not
  // when exactly it began.
  double clientTS = static_cast<double>(startTS) + (event.timestamp.asSeconds() - facts_->startTimeStamp);
  if (!std::isfinite(clientTS)) clientTS = -1.0;
  writer.set(keys.clientTS, clientTS);
  writer.set(keys.eventTime, clientTS);
  writer.setWhenKnown(keys.productFamily, facts_->productFamily);
  writer.setWhenKnown(keys.productModel, facts_->hardwareType);
  writer.setWhenKnown(keys.osVersion, facts_->productVersion);
  writer.setWhenKnown(keys.build, facts_->buildVersion);
  writer.set(keys.internal, configuration_.deviceIdentity.isInternalBuild() ? 1u : 0u);
  writer.set(keys.reportVers, reportVersion_);
  writer.set(keys.timezoneOffset, platform.deviceProperties.secondsFromGMT(platform.clock.timeOfDay()));
  return record;
}

}  // namespace kyt
