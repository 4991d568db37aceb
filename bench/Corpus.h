// The seeded corpus of all benchmarks: events of ten payload entries that become records of 26 keys and about
// 600 bytes of JSON, compressing about four to one in batches of 50; and the storebag and session that they
// go through.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::bench {

// `count` different payloads, always the same ones.
[[nodiscard]] std::vector<Dictionary> corpusPayloads(size_t count);
// One SendMessageWithDictionary call that expects no reply.
void appendEventCall(std::string& out, uint32_t serial, uint16_t category, const Dictionary& payload);
// The handshake, SetSessionInfo and StartConfigWithCompletionHandler, whose reply ends the set-up.
[[nodiscard]] std::string openingCalls(uint32_t sessionID);
// Ten filters that a record must be compared with, no lists, consent overridden, a flush for every 51st event
// of a method.
[[nodiscard]] Dictionary benchBag(const std::string& postURL, int eventThreshold);

}  // namespace kyt::bench
