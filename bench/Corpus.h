// The seeded corpora of all benchmarks, and the storebag and session that their events go through. Events of ten payload
// entries become records of 26 keys and about 600 bytes of JSON. Those of random digits compress about four to one in
// batches of 50; ordinary ones, of words, counters and measurements, more than ten to one in batches of 1000.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::bench {

// `count` different payloads, always the same ones: of random digits; ordinary ones, of so many entries.
[[nodiscard]] std::vector<Dictionary> corpusPayloads(size_t count);
[[nodiscard]] std::vector<Dictionary> ordinaryPayloads(size_t count, size_t fields = 10);
// One SendMessageWithDictionary call that expects no reply.
void appendEventCall(std::string& out, uint32_t serial, uint16_t category, const Dictionary& payload);
// The handshake, SetSessionInfo and StartConfigWithCompletionHandler, whose reply ends the set-up.
[[nodiscard]] std::string openingCalls(uint32_t sessionID);
// Ten filters that a record must be compared with, no lists, a flush when more than `eventThreshold` events of a method
// wait. Without `consent` the bag overrides that it is missing.
[[nodiscard]] Dictionary benchBag(const std::string& postURL, int eventThreshold, bool consent = false);

}  // namespace kyt::bench
