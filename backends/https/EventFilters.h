// Which keys of an event record are removed, or replaced by their SHA-256 text, before it leaves the device;
// and the two rules by which a name is looked for in a list of the storebag. Used by HTTPSPostBackend alone,
// on its session's queue.
//
// Texts are compared without case (backend/Text.h). Keys are folded once, when the table is built: each
// record of each event passes all filters.
#pragma once

#include <bitset>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "backend/Text.h"
#include "platform/base/Function.h"
#include "platform/objects/Value.h"

namespace kyt {

// `list` may be null: a missing list. Returns `whitelist` for an empty or missing list, the opposite for a missing
// string; otherwise whether some element equals the string. An empty element matches nothing.
[[nodiscard]] bool matchExactStringWithList(const Array* list, const String* wholeString, bool whitelist);
// The same, but whether the string contains some element.
[[nodiscard]] bool matchStringWithList(const Array* list, const String* wholeString, bool whitelist);

class EventFilters {
 public:
  static constexpr size_t kShapes = 1024;
  enum class Action : int32_t { keep = 0, remove = 1, sha256 = 2 };
  // The text of the digest of a text.
  using Digest = Function<String(const String&)>;

  // Builds the table from the storebag's filter dictionaries. An empty array deliberately leaves the earlier
  // table in force: a bag that forgets its filters must not lay the keys open.
  void createFiltersFromArray(const Array& filters);
  // For each key of the record the first filter in table order that is about it decides, whatever follows.
  void filterEvent(Dictionary& event, Digest& digest) const;
  [[nodiscard]] int32_t numberOfFilters() const { return static_cast<int32_t>(filters_.size()); }

 private:
  struct Filter {
    int32_t method = -1;  // negative: any
    int32_t status = -1;  // negative: any
    Action action = Action::keep;
    std::optional<std::string> foldedKey;  // none: counted, but matches nothing
    UnfoldedSizes sizes;                   // of the keys that fold to it
    uint32_t ends = 0;                     // of it; keys with ASCII ends have the same
  };
  struct Numbers {
    int32_t method, status;  // of the record
  };
  void addShapes(const Filter& filter);
  [[nodiscard]] Action actionForKey(std::string_view key, const Numbers& numbers) const;
  [[nodiscard]] bool mustRemove(const Dictionary& event, const String& key, Value& value,
                                std::optional<Numbers>& numbers, Digest& digest) const;

  std::vector<Filter> filters_;
  bool asksMethod_ = false, asksStatus_ = false;  // whether some filter is bound to one
  std::bitset<kShapes> keyShapes_;                // of the filters' keys (EventFilters.cpp)
};

}  // namespace kyt
