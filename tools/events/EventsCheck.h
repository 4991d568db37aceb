// Whether what an events.toml declares fits a storebag: what would leave a device unguarded, and what would not leave it
// though its author may think so. By the daemon's own rules of matching and filtering. One thread.
//
// In each section and back end of posts the client entries are looked at that may govern the program's sessions: those
// that fit the file's client and service, or all where the file names none. An event is refused where no entry of a
// section takes its category; its fields are judged by every entry that does.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/objects/Value.h"
#include "tools/events/EventsFile.h"

namespace kyt::tools {

struct EventFinding {
  uint32_t line = 0;         // of the file; 0: the whole
  std::string event, field;  // empty: none of these
  // "client-not-listed", "category-0", "category-refused", "personal-unfiltered", "not-posted", "replaced"
  std::string kind;
  std::string text;  // a sentence, in plain text
};

inline constexpr size_t kMostFindings = 1000;  // then they are counted alone

struct EventsVerdict {
  std::vector<EventFinding> findings;  // in the order of their lines
  size_t further = 0;                  // findings past kMostFindings
};

// `bag`: its root, as StorebagFile reads it.
[[nodiscard]] EventsVerdict checkEvents(const EventsFile& file, const Dictionary& bag);

}  // namespace kyt::tools
