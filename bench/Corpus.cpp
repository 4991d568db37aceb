#include "bench/Corpus.h"

#include <unistd.h>

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

Dictionary benchBag(const std::string& postURL, int eventThreshold) {
  Array filters;
  for (const char* key : {"secret", "account", "email", "phone", "address", "token", "cookie"})
    filters.append(Dictionary{{"key", key}, {"action", "remove"}});
  filters.append(Dictionary{{"key", "callID"}, {"action", "sha256"}, {"method", 9999}});
  filters.append(Dictionary{{"key", "latitude"}, {"action", "remove"}});
  filters.append(Dictionary{{"key", "longitude"}, {"action", "remove"}});
  const Dictionary client = {{"client", "bench"},
                             {"expedite", 0},
                             {"override_dnu", 1},
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
