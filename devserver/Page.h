// The web page, compiled into the program from page.html.
#pragma once

#include <string_view>

namespace kyt::devserver {

extern const std::string_view kPage;

}  // namespace kyt::devserver
