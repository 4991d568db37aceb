#include "backends/https/EventFilters.h"

#include <algorithm>

#include "backend/Text.h"
#include "platform/base/Hex.h"

namespace kyt {

namespace {

// A number below kShapes for the length and both ends of a key. ASCII ends that differ in case alone have the same; ends
// of which one is not ASCII have none.
[[gnu::always_inline]] inline size_t shapeOf(size_t size, uint32_t ends) {
  static_assert(EventFilters::kShapes == 1024);
  return ((static_cast<uint32_t>(size) << 16 | ends) * 0x9E3779B1u) >> 22;
}
[[gnu::always_inline]] inline uint32_t endsOf(std::string_view key) {
  const auto byte = [](char c) { return uint32_t{static_cast<unsigned char>(c)}; };
  const uint32_t ends = byte(key.front()) << 8 | byte(key.back());
  return (ends & 0x8080u) == 0 ? ends | 0x2020u : 0;
}
// Most keys of a record are about no filter, and this is what they cost.
[[gnu::always_inline]] inline size_t shapeOf(std::string_view key) {
  return key.empty() ? 0 : shapeOf(key.size(), endsOf(key));
}

template <typename Matches>
bool matchList(const Array* list, const String* wholeString, bool whitelist, Matches matches) {
  if (list == nullptr || list->empty()) return whitelist;
  if (wholeString == nullptr) return !whitelist;
  const std::string whole = foldCase(*wholeString);
  return std::any_of(list->begin(), list->end(), [&](const Value& element) {
    const String* text = element.string();
    return text != nullptr && !text->empty() && matches(whole, foldCase(*text));
  });
}

// What is hashed for a value: its own text, or the text that a reader would see posted. None for what could
// not be posted and must not leave unhashed.
std::optional<String> textToHash(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::string:
      return *value.string();
    case Value::Kind::date:
      return String(description(Value(value.date()->secondsSince1970)));
    case Value::Kind::data: {
      std::string hex;
      appendHex(value.data()->bytes(), hex);
      return String(hex);
    }
    case Value::Kind::null:
    case Value::Kind::array:
    case Value::Kind::dictionary:
      return std::nullopt;
    default:
      return String(description(value));
  }
}

}  // namespace

bool matchExactStringWithList(const Array* list, const String* wholeString, bool whitelist) {
  return matchList(list, wholeString, whitelist,
                   [](const std::string& whole, const std::string& element) { return whole == element; });
}

bool matchStringWithList(const Array* list, const String* wholeString, bool whitelist) {
  return matchList(list, wholeString, whitelist, [](const std::string& whole, const std::string& element) {
    return whole.find(element) != std::string::npos;
  });
}

void EventFilters::createFiltersFromArray(const Array& filters) {
  if (filters.empty()) return;
  filters_.clear();
  filters_.reserve(filters.size());
  keyShapes_.reset();
  asksMethod_ = asksStatus_ = false;
  for (const Value& element : filters) {
    Filter filter;
    if (const Dictionary* dictionary = element.dictionary()) {
      filter.method = dictionary->integer("method", -1);
      filter.status = dictionary->integer("status", -1);
      asksMethod_ |= filter.method >= 0;
      asksStatus_ |= filter.status >= 0;
      if (const String* key = dictionary->string("key")) {
        filter.foldedKey = foldCase(*key);
        filter.sizes = unfoldedSizes(*filter.foldedKey);
        filter.ends = filter.foldedKey->empty() ? 0 : endsOf(*filter.foldedKey);
        addShapes(filter);
      }
      const String* action = dictionary->string("action");
      if (action != nullptr && *action == "remove") filter.action = Action::remove;
      if (action != nullptr && *action == "sha256") filter.action = Action::sha256;
    }
    filters_.push_back(std::move(filter));
  }
}

// Of every key that folds to the filter's. There are few: the letters with forms of other lengths are rare.
void EventFilters::addShapes(const Filter& filter) {
  if (filter.foldedKey->empty()) keyShapes_.set(shapeOf(*filter.foldedKey));
  if (filter.foldedKey->empty()) return;
  const uint32_t ends = endsOf(*filter.foldedKey);
  for (size_t size = filter.sizes.least; size <= filter.sizes.most; ++size) {
    if (filter.sizes.endsMayBeASCII) keyShapes_.set(shapeOf(size, ends));
    if (filter.sizes.endsMayBeNonASCII) keyShapes_.set(shapeOf(size, 0));
  }
}

EventFilters::Action EventFilters::actionForKey(std::string_view key, const Numbers& numbers) const {
  const uint32_t ends = key.empty() ? 0 : endsOf(key);
  for (const Filter& filter : filters_) {
    if (!filter.foldedKey || key.size() < filter.sizes.least || key.size() > filter.sizes.most) continue;
    if (ends != 0 && ends != filter.ends) continue;
    if (filter.method >= 0 && filter.method != numbers.method) continue;
    if (filter.status >= 0 && filter.status != numbers.status) continue;
    if (equalsFolded(key, *filter.foldedKey)) return filter.action;
  }
  return Action::keep;
}

void EventFilters::filterEvent(Dictionary& event, Digest& digest) const {
  if (filters_.empty()) return;
  std::optional<Numbers> numbers;
  event.removeIf([&](const String& key, Value& value) {
    return keyShapes_[shapeOf(key)] && mustRemove(event, key, value, numbers, digest);
  });
}

// Whether the entry is to be removed; hashes its value where that is asked for. `numbers` are read before any change,
// which none but a key of a filter's shape brings; a record without them counts as method 0 and status 0, deliberately.
[[gnu::noinline]] bool EventFilters::mustRemove(const Dictionary& event, const String& key, Value& value,
                                                std::optional<Numbers>& numbers, Digest& digest) const {
  if (!numbers)
    numbers = Numbers{asksMethod_ ? event.integer("_method") : 0, asksStatus_ ? event.integer("_status") : 0};
  switch (actionForKey(key, *numbers)) {
    case Action::keep:
      return false;
    case Action::remove:
      return true;
    case Action::sha256:
      break;
  }
  const std::optional<String> text = textToHash(value);
  if (!text) return true;
  value = Value(digest(*text));
  return false;
}

}  // namespace kyt
