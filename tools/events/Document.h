// What a program reports as a page in Markdown, for the owners of devices and for those who review the program. The same
// file gives the same page. One thread.
#pragma once

#include <string>
#include <string_view>

#include "tools/events/EventsFile.h"

namespace kyt::tools {

[[nodiscard]] std::string documentEvents(const EventsFile& file);

// Text as Markdown that shows it: nothing in it is a mark, a link or a table's edge. One line for each of its paragraphs.
[[nodiscard]] std::string markdownText(std::string_view text);

}  // namespace kyt::tools
