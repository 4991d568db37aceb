// An event's record. The keys are inline strings, made once: the road of one event allocates one block for
// its record.
#include <array>
#include <cmath>
#include <string_view>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "config/ClientTypes.h"
#include "config/DeviceIdentity.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/objects/Description.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr size_t kFixedKeys = 16;
constexpr int64_t kSecondsPerMinute = 60;

constexpr int32_t kClientTypeQH = 7;
constexpr int32_t kClientTypeQM = 11;
constexpr int32_t kClientTypeQPRAV = 13;

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

// A fixed key begins with an underscore, or is the one that does not.
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

// "." and the minor, or nothing when that is 0.
std::string HTTPSPostBackend::versionSuffix() const {
  return facts().selfVersion[2] != 0 ? "." + std::to_string(facts().selfVersion[2]) : std::string();
}

String HTTPSPostBackend::formattedReportVersion() const {
  const std::array<uint8_t, 3>& version = facts().selfVersion;
  return String(formatObjects("%u.%u%@", {unsigned{version[0]}, unsigned{version[1]}, versionSuffix()}));
}

Dictionary HTTPSPostBackend::newEventDictfromPayload(Dictionary payload, const TimeValue& timestamp,
                                                     uint16_t method, uint16_t respCode, EventID) const {
  return makeRecord(std::move(payload), timestamp, method, respCode, combinedSessionIDString(), 0);
}

Dictionary HTTPSPostBackend::makeRecord(Dictionary payload, const TimeValue& timestamp, uint16_t method,
                                        uint16_t respCode, const std::optional<String>& sessionID,
                                        size_t room) const {
  const RecordKeys& keys = recordKeys();
  Dictionary record = std::move(payload);
  RecordWriter writer(record, mayHoldFixedKey(record));
  record.reserve(record.size() + kFixedKeys + room + (userInfoDict() ? userInfoDict()->size() : 0));

  const int64_t startTS =
      Value(facts().startTimeStamp).longLongValue() / kSecondsPerMinute * kSecondsPerMinute;
  writer.set(keys.startTS, startTS);
  writer.set(keys.sender, clientTypeShortCode(facts().compType));
  writer.set(keys.clientVersion, static_cast<unsigned>(facts().clientVersion));
  const bool numericSessionID =
      facts().compType == kClientTypeQH ||
      (facts().isInternal && (facts().compType == kClientTypeQM || facts().compType == kClientTypeQPRAV));
  if (numericSessionID) {
    writer.set(keys.sessionID, facts().sessionID);
  } else {
    writer.setWhenKnown(keys.sessionID, sessionID);
  }
  writer.set(keys.eventNumber, static_cast<unsigned>(eventNumber()));
  writer.set(keys.method, static_cast<unsigned>(method));
  writer.set(keys.status, static_cast<unsigned>(respCode));
  // The offset is added to the start cut to its minute, deliberately: records tell the session's course, not
  // when exactly it began.
  double clientTS = static_cast<double>(startTS) + (timestamp.asSeconds() - facts().startTimeStamp);
  if (!std::isfinite(clientTS)) clientTS = -1.0;
  writer.set(keys.clientTS, clientTS);
  writer.set(keys.eventTime, clientTS);
  writer.setWhenKnown(keys.productFamily, facts().productFamily);
  writer.setWhenKnown(keys.productModel, facts().hardwareType);
  writer.setWhenKnown(keys.osVersion, facts().productVersion);
  writer.setWhenKnown(keys.build, facts().buildVersion);
  writer.set(keys.internal, configuration_.deviceIdentity.isInternalBuild() ? 1u : 0u);
  writer.set(keys.reportVers, reportVersion_);
  writer.set(keys.timezoneOffset, platform().deviceProperties.secondsFromGMT(platform().clock.timeOfDay()));
  return record;
}

void HTTPSPostBackend::prepareEventForMessage(Dictionary& event, const Dictionary* frameworkData) const {
  if (userInfoDict()) event.merge(*userInfoDict());
  if (frameworkData != nullptr) event.merge(*frameworkData);
  filterEvent(event);
}

void HTTPSPostBackend::filterEvent(Dictionary& event) const {
  EventFilters::Digest digest = [this](const String& text) { return convertIntoSHA256(text); };
  filters_.filterEvent(event, digest);
}

}  // namespace kyt
