// The objects on the road of one event: building a record of 26 keys and about 600 bytes, copying it,
// changing the copy, and writing it as JSON. References for the same work stand beside: RapidJSON's document
// for building and copying, and RapidJSON's own writer over a finished document for JSON.
#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <array>
#include <string>
#include <vector>

#include "bench/Measure.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/objects/Value.h"

namespace kyt {
namespace {

constexpr std::array<const char*, 16> kTextKeys = {
    "_sender",        "_method",      "_deviceType",    "_osVersion",        "_build",    "_clientVersion",
    "_correlationID", "_sessionUUID", "networkID",      "connection",        "codecName", "relayAddress",
    "endReason",      "transport",    "experimentName", "remoteBuildVersion"};
constexpr std::array<const char*, 10> kNumberKeys = {"_eventNumber", "_eventTime",  "_respCode", "bitrate",
                                                     "lossRate",     "roundTrip",   "frames",    "stalls",
                                                     "jitterMax",    "batteryLevel"};

std::string textOf(size_t i) {
  static constexpr const char* kTexts[] = {"QH",
                                           "17",
                                           "Model14,2",
                                           "17.4.1",
                                           "21E236",
                                           "5",
                                           "Zm9vYmFyYmF6MTIzNDU2Nw==:Zm9vYmFy",
                                           "Zm9vYmFyYmF6MTIzNDU2Nw==",
                                           "wifi-5GHz",
                                           "direct",
                                           "hevc",
                                           "192.0.2.17",
                                           "local-hangup",
                                           "udp",
                                           "baseline-v2",
                                           "21E5195e"};
  return kTexts[i];
}

const std::array<String, 16>& textKeys() {
  static const std::array<String, 16> keys = [] {
    std::array<String, 16> made;
    for (size_t i = 0; i < made.size(); ++i) made[i] = String::permanent(kTextKeys[i]);
    return made;
  }();
  return keys;
}

const std::array<String, 10>& numberKeys() {
  static const std::array<String, 10> keys = [] {
    std::array<String, 10> made;
    for (size_t i = 0; i < made.size(); ++i) made[i] = String::permanent(kNumberKeys[i]);
    return made;
  }();
  return keys;
}

// As a back end does it: keys and most texts are there already, numbers come with the event.
Dictionary record(const std::array<Value, 16>& texts, int64_t number) {
  Dictionary made;
  made.reserve(26);
  for (size_t i = 0; i < texts.size(); ++i) made.set(textKeys()[i], texts[i]);
  for (size_t i = 0; i < 8; ++i) made.set(numberKeys()[i], number + static_cast<int64_t>(i) * 1000);
  made.set(numberKeys()[8], 0.125 * static_cast<double>(number));
  made.set(numberKeys()[9], 1769860800.123456);
  return made;
}

std::array<Value, 16> texts() {
  std::array<Value, 16> made;
  for (size_t i = 0; i < made.size(); ++i) made[i] = textOf(i);
  return made;
}

rapidjson::Document document() {
  rapidjson::Document made(rapidjson::kObjectType);
  auto& allocator = made.GetAllocator();
  for (size_t i = 0; i < 16; ++i)
    made.AddMember(rapidjson::StringRef(kTextKeys[i]), rapidjson::Value(textOf(i).c_str(), allocator),
                   allocator);
  for (size_t i = 0; i < 8; ++i)
    made.AddMember(rapidjson::StringRef(kNumberKeys[i]), static_cast<int64_t>(1 + i * 1000), allocator);
  made.AddMember(rapidjson::StringRef(kNumberKeys[8]), 0.125, allocator);
  made.AddMember(rapidjson::StringRef(kNumberKeys[9]), 1769860800.123456, allocator);
  return made;
}

void BuildRecord(bench::Rounds& rounds) {
  const auto ready = texts();
  int64_t number = 0;
  while (rounds.more()) {
    Dictionary made = record(ready, ++number);
    bench::keep(made);
  }
}
KYT_MEASURE(BuildRecord);

void BuildRecordReferenceDocument(bench::Rounds& rounds) {
  while (rounds.more()) {
    rapidjson::Document made = document();
    bench::keep(made);
  }
}
KYT_MEASURE(BuildRecordReferenceDocument);

void CopyRecord(bench::Rounds& rounds) {
  const Dictionary made = record(texts(), 1);
  while (rounds.more()) {
    Dictionary copy(made);
    bench::keep(copy);
  }
}
KYT_MEASURE(CopyRecord);
KYT_MEASURE(CopyRecord, {0}, 4);

void ChangeCopyOfRecord(bench::Rounds& rounds) {
  const Dictionary made = record(texts(), 1);
  while (rounds.more()) {
    Dictionary copy(made);
    copy.set(numberKeys()[0], 2);
    bench::keep(copy);
  }
}
KYT_MEASURE(ChangeCopyOfRecord);

void CopyReferenceDocument(bench::Rounds& rounds) {
  const rapidjson::Document made = document();
  while (rounds.more()) {
    rapidjson::Document copy;
    copy.CopyFrom(made, copy.GetAllocator());
    bench::keep(copy);
  }
}
KYT_MEASURE(CopyReferenceDocument);

void FindEveryKey(bench::Rounds& rounds) {
  const Dictionary made = record(texts(), 1);
  while (rounds.more())
    for (const DictionaryEntry& entry : made) bench::keep(made.find(entry.key));
  rounds.setItems(rounds.count() * 26);
}
KYT_MEASURE(FindEveryKey);

void WriteJSON(bench::Rounds& rounds) {
  const Value made(record(texts(), 1));
  RapidJSON json;
  std::string out;
  while (rounds.more()) {
    out.clear();
    json.writeCompact(made, out);
    bench::keep(out.data());
  }
  rounds.addFigure("bytes", static_cast<double>(out.size()));
}
KYT_MEASURE(WriteJSON);

void WriteJSONReferenceWriter(bench::Rounds& rounds) {
  const rapidjson::Document made = document();
  rapidjson::StringBuffer buffer;
  while (rounds.more()) {
    buffer.Clear();
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    made.Accept(writer);
    bench::keep(buffer.GetString());
  }
  rounds.addFigure("bytes", static_cast<double>(buffer.GetSize()));
}
KYT_MEASURE(WriteJSONReferenceWriter);

void SetManyKeys(bench::Rounds& rounds) {
  std::vector<String> keys;
  for (size_t i = 0; i < rounds.argument(); ++i) keys.emplace_back("hostile key " + std::to_string(i));
  while (rounds.more()) {
    Dictionary made;
    for (const String& key : keys) made.set(key, 1);
    bench::keep(made);
  }
  rounds.setItems(rounds.count() * rounds.argument());
}
KYT_MEASURE(SetManyKeys, {32, 1000, 60000});

}  // namespace
}  // namespace kyt
