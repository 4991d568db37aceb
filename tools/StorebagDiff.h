// What changes when one bag takes the place of another, in sentences for people: by section, back end, client entry and
// rule, with what follows for devices where that is not plain from the values. Pure; any thread.
#pragma once

#include <string>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::tools {

// One line each, in the order of the new bag; empty: nothing changes for devices. Client entries are the same entry when
// they are for the same client, service and version.
[[nodiscard]] std::vector<std::string> storebagChanges(const Dictionary& before, const Dictionary& after);

// Whom a client entry is for, as findings about it name it: client "a", service "b", since "8.0".
[[nodiscard]] std::string storebagEntryName(const Dictionary& entry);

}  // namespace kyt::tools
