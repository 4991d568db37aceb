// Puts a signed storebag where a web server serves it from, so that no reader ever sees half of one, none is lost, and each
// has a newer time than the one before: servers that answer "not modified" to whoever has a newer one would hide it
// otherwise. Blocks for the disk. Several publishers of one folder take turns.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <variant>

#include "platform/base/Error.h"

namespace kyt::tools {

// Where the documents that were replaced stay, below the folder: NAME.TIME, the time as their "Last-Modified" said it; of
// several of one time the second is NAME.TIME.2.
inline constexpr char kPublishedBefore[] = ".published";

struct Publication {
  std::string file;      // where it is now
  std::string kept;      // where the one before it is; empty: there was none
  int64_t modified = 0;  // seconds since 1970, as servers will say
  bool isAhead = false;  // that is later than now
};

// `name`: of a file in the folder, which must exist; `now`: seconds since 1970. After an error the folder serves what it
// served before.
[[nodiscard]] std::variant<Publication, Error> publish(std::string_view document, const std::string& folder,
                                                       const std::string& name, int64_t now);

}  // namespace kyt::tools
