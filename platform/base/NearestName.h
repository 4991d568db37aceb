// The name that somebody may have meant who wrote one that there is not. For messages to people; any thread.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace kyt {

// Of `known` the one that the fewest letters (put in, left out, another) tell from `name`: two at most, or a third of the
// name's where that is more; none when no name is as near. Case does not count as a difference of letters here.
[[nodiscard]] std::optional<std::string> nearestName(std::string_view name,
                                                     std::span<const std::string> known);

}  // namespace kyt
