#include "bench/Corpus.h"

#include <unistd.h>

#include <algorithm>
#include <random>

#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/objects/Keys.h"

namespace kyt::bench {

namespace {

// Drawn from the generator's bits alone, so that every standard library makes the same corpus.
class Draws {
 public:
  explicit Draws(uint32_t seed) : engine_(seed) {}
  uint32_t below(uint32_t bound) { return static_cast<uint32_t>(engine_() % bound); }
  std::string word(const std::vector<std::string>& words) {
    return words[below(static_cast<uint32_t>(words.size()))];
  }
  std::string hex(size_t digits) {
    std::string text;
    for (size_t i = 0; i < digits; ++i) text += "0123456789abcdef"[below(16)];
    return text;
  }

 private:
  std::mt19937 engine_;
};

}  // namespace

std::vector<Dictionary> corpusPayloads(size_t count) {
  Draws draws(20260131);
  const std::vector<std::string> networks = {"wifi", "cellular", "ethernet"};
  std::vector<Dictionary> out;
  for (size_t i = 0; i < count; ++i) {
    Dictionary payload;
    payload.set("callID", draws.hex(32));
    payload.set("peerID", draws.hex(32));
    payload.set("network", draws.word(networks));
    payload.set("route", draws.hex(40));
    payload.set("nonce", draws.hex(40));
    payload.set("duration", static_cast<double>(draws.below(1u << 31)) / 1048576.0);
    payload.set("bitrate", static_cast<int64_t>(draws.below(4000000)));
    payload.set("packetLoss", static_cast<double>(draws.below(1u << 31)) / 4294967296.0);
    payload.set("jitter", static_cast<double>(draws.below(1u << 31)) / 33554432.0);
    payload.set("relayed", draws.below(2) == 1);
    out.push_back(std::move(payload));
  }
  return out;
}

namespace {

std::string numbered(const char* stem, uint32_t number, int digits) {
  std::string figures = std::to_string(number);
  figures.insert(0, static_cast<size_t>(digits) - std::min(figures.size(), static_cast<size_t>(digits)), '0');
  return stem + figures;
}

// Those beyond the ten: alternately a text of a few, an integer and a double.
Value furtherValue(Draws& draws, size_t i) {
  const uint32_t drawn = draws.below(1u << 20);
  if (i % 3 == 0) return Value(numbered("value-", 100000 + drawn % 64 * 7919, 6));
  if (i % 3 == 1) return Value(static_cast<int64_t>(drawn));
  return Value(static_cast<double>(drawn) / 1e4);
}

}  // namespace

std::vector<Dictionary> ordinaryPayloads(size_t count, size_t fields) {
  Draws draws(20260201);
  std::vector<Dictionary> out;
  for (size_t i = 0; i < count; ++i) {
    Dictionary payload = {{"id", numbered("@E00", static_cast<uint32_t>(i), 8)},
                          {"state", numbered("running-", draws.below(9000), 4)},
                          {"component", numbered("netmanager", draws.below(37), 2)},
                          {"segment", numbered("segment-", draws.below(1000), 4)},
                          {"channel", numbered("release-", draws.below(12), 4)},
                          {"count", static_cast<int64_t>(i)},
                          {"latency", static_cast<int64_t>(draws.below(100000))},
                          {"bytes", static_cast<int64_t>(draws.below(10000000))},
                          {"ratio", static_cast<double>(draws.below(1000000)) / 1e6},
                          {"ok", draws.below(2) == 1}};
    for (size_t field = payload.size(); field < fields; ++field)
      payload.set(numbered("field_", static_cast<uint32_t>(field), 3), furtherValue(draws, field));
    if (fields < payload.size()) {
      size_t kept = 0;
      payload.removeIf([&kept, fields](const String&, Value&) { return kept++ >= fields; });
    }
    out.push_back(std::move(payload));
  }
  return out;
}

void appendEventCall(std::string& out, uint32_t serial, uint16_t category, const Dictionary& payload) {
  MessageWriter writer(out);
  MessageWriter::Call call;
  call.member = "SendMessageWithDictionary";
  call.signature = "a{sv}";
  call.expectsReply = false;
  writer.beginCall(serial, call);
  writer.writeDictionary({{kKYTReportingMessageParametersCategory, static_cast<unsigned>(category)},
                          {kKYTReportingMessageParametersType, 1u},
                          {kKYTReportingMessageParametersPayload, payload}});
  if (!writer.end()) std::abort();
}

std::string openingCalls(uint32_t sessionID) {
  std::string out = ClientHandshake::opening(geteuid());
  MessageWriter writer(out);
  MessageWriter::Call info;
  info.member = "SetSessionInfo";
  info.signature = "a{sv}aa{sv}avb";
  info.expectsReply = false;
  writer.beginCall(1, info);
  writer.writeDictionary({{kKYTReportingSessionInfoSessionID, sessionID},
                          {kKYTReportingSessionInfoClientType, 8},
                          {kKYTReportingSessionInfoClientVersion, 1},
                          {kKYTReportingSessionInfoBatchEvent, true},
                          {kKYTReportingSessionInfoRequireUserInfo, true}});
  writer.writeOptionalDictionary(
      Dictionary{{kKYTReportingUserInfoClientName, "bench"}, {kKYTReportingUserInfoServiceName, "bench"}});
  writer.writeOptionalValue(Value());
  writer.writeBoolean(false);
  if (!writer.end()) std::abort();
  MessageWriter::Call configure;
  configure.member = "StartConfigWithCompletionHandler";
  writer.beginCall(2, configure);
  if (!writer.end()) std::abort();
  return out;
}

Dictionary benchBag(const std::string& postURL, int eventThreshold, bool consent) {
  Array filters;
  for (const char* key : {"secret", "account", "email", "phone", "address", "token", "cookie"})
    filters.append(Dictionary{{"key", key}, {"action", "remove"}});
  filters.append(Dictionary{{"key", "callID"}, {"action", "sha256"}, {"method", 9999}});
  filters.append(Dictionary{{"key", "latitude"}, {"action", "remove"}});
  filters.append(Dictionary{{"key", "longitude"}, {"action", "remove"}});
  const Dictionary client = {{"client", "bench"},
                             {"expedite", 0},
                             {"override_dnu", consent ? 0 : 1},
                             {"locale_whitelist", Array{"DE"}},
                             {"filters", filters},
                             {"sampling_threshold", 1.0},
                             {"event_threshold", eventThreshold},
                             {"post_url", postURL}};
  return {{"version", "bench"},
          {"refresh_cycle", 86400},
          {"vantu_internal", Dictionary{{"httppost", Dictionary{{"clients", Array{client}}}}}}};
}

}  // namespace kyt::bench
