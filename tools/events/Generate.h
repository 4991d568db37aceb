// Source code by which a program fills and sends the events of its events.toml through the client library: a type and a
// function for each, with what their fields mean and which are personal. The same file gives the same text. One thread.
#pragma once

#include <cstdint>
#include <string>

#include "tools/events/EventsFile.h"

namespace kyt::tools {

enum class EventsLanguage : uint8_t { c, cxx, python };

// Precondition: no event has category 0, which is the daemon's own.
[[nodiscard]] std::string generateEvents(const EventsFile& file, EventsLanguage language);

[[nodiscard]] std::string generateC(const EventsFile& file);
[[nodiscard]] std::string generateCxx(const EventsFile& file);
[[nodiscard]] std::string generatePython(const EventsFile& file);

// What stands above an event and a field, in words.
[[nodiscard]] std::string eventComment(const DeclaredEvent& event);
[[nodiscard]] std::string fieldComment(const EventField& field, const std::string& identifier);
// The file's own name, without its folders.
[[nodiscard]] std::string baseNameOf(const EventsFile& file);

}  // namespace kyt::tools
