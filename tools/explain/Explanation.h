// What becomes of one event on one device, and why: the report behind `kytctl explain`, a dictionary that is printed as it
// is or laid out for people. Everything in it comes from a rehearsal; nothing is judged here but what several findings
// mean together. One thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/objects/Value.h"
#include "tools/explain/Rehearsal.h"

namespace kyt::tools {

enum class Verdict : uint8_t { leaves = 0, doesNotLeave = 1, cannotBeTold = 2 };  // the exit statuses

[[nodiscard]] const char* verdictName(Verdict verdict);

// What was found out about the device before the rehearsal.
struct ExplainFacts {
  Dictionary message;  // the event as it goes over the wire
  RehearsedProgram program;
  std::optional<uint32_t> draw;  // hundredths; none: all of them are tried
  // Of the program: 0 granted, 1 refused, 2 cannot be told; and what was looked at.
  int entitlement = 0;
  std::vector<std::string> entitlementLines;
  std::string storebagSignature = "required";  // or who else looked at it, or that nobody did
  std::vector<std::string> unreadable;         // "FILE: REASON"
};

struct Explanation {
  Verdict verdict = Verdict::cannotBeTold;
  Dictionary report;
};

// The two texts are read after the rehearsal, which fills them in.
struct ExplainStorebag {
  Rehearsal::StorebagServer server;
  const std::string& from;     // an address or a file
  const std::string& problem;  // why the server gave no answer at all; empty: it did
};

[[nodiscard]] Explanation explain(const RehearsedDevice& device, const ExplainStorebag& storebag,
                                  const ExplainFacts& facts);

}  // namespace kyt::tools
