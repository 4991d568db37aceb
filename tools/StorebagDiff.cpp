#include "tools/StorebagDiff.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <optional>
#include <string_view>
#include <utility>

#include "platform/objects/Description.h"

namespace kyt::tools {

namespace {

using Lines = std::vector<std::string>;

constexpr char kNothingSent[] = "sessions that require user information send nothing";

std::string shown(const Value* value) {
  if (value == nullptr) return "nothing";
  return value->isString() ? "\"" + description(*value) + "\"" : description(*value);
}

// Sessions that report, of a hundred; the draw is one of 101.
std::string shareText(const Value* threshold) {
  if (threshold == nullptr) return kNothingSent;
  const double share = std::clamp((std::floor(threshold->doubleValue() * 100 + 1e-9) + 1) / 1.01, 0.0, 100.0);
  char text[64];
  std::snprintf(text, sizeof text, "about %.0f of 100 sessions report", share);
  return text;
}

std::string filterText(const Value& element) {
  const Dictionary* filter = element.dictionary();
  if (filter == nullptr) return description(element);
  const String* action = filter->string("action");
  std::string text = action != nullptr ? action->str() : std::string("(no action)");
  text += " " + shown(filter->find("key"));
  for (const char* bound : {"method", "status"})
    if (const Value* value = filter->find(bound))
      text += std::string(", ") + bound + " " + description(*value);
  return text;
}

std::string elementText(const char* key, const Value& element) {
  return std::string_view(key) == "filters" ? filterText(element) : shown(&element);
}

Lines elementTexts(const char* key, const Array& list) {
  Lines texts;
  for (const Value& element : list) texts.push_back(elementText(key, element));
  return texts;
}

std::string joined(const Lines& texts) {
  std::string out;
  for (const std::string& text : texts) out += (out.empty() ? "" : "; ") + text;
  return out;
}

Lines without(const Lines& texts, const Lines& others) {
  Lines left;
  for (const std::string& text : texts)
    if (std::find(others.begin(), others.end(), text) == others.end()) left.push_back(text);
  return left;
}

std::string listChange(const char* key, const Array& before, const Array& after) {
  const Lines old = elementTexts(key, before), now = elementTexts(key, after);
  const Lines gone = without(old, now), come = without(now, old);
  std::string text;
  if (!come.empty()) text += "adds " + joined(come);
  if (!gone.empty()) text += std::string(text.empty() ? "" : ", ") + "takes away " + joined(gone);
  if (text.empty()) text = "the order becomes " + joined(now);
  return text;
}

// What follows where a rule changes; empty: the values say it.
std::string consequence(std::string_view key, const Value* before, const Value* after) {
  if (key == "sampling_threshold")
    return before != nullptr && after != nullptr ? shareText(after) + ", before " + shareText(before)
                                                 : shareText(after);
  if ((key == "locale_whitelist" || key == "filters") && (after == nullptr || !after->isArray()))
    return kNothingSent;
  if (key == "locale_whitelist" && after->array()->empty()) return kNothingSent;
  if (key == "post_url" && after == nullptr) return "events have nowhere to go";
  if (key == "refresh_cycle")
    return after == nullptr
               ? "the server's Cache-Control says when devices ask again"
               : "devices ask again after " + std::to_string(std::min(after->intValue(), 86400)) + " seconds";
  return {};
}

void addRule(const std::string& where, const std::string& key, const Value* before, const Value* after,
             Lines& out) {
  if (before != nullptr && after != nullptr && *before == *after) return;
  std::string text = where + key + ": ";
  const Array* old = before != nullptr ? before->array() : nullptr;
  const Array* now = after != nullptr ? after->array() : nullptr;
  if (old != nullptr && now != nullptr)
    text += listChange(key.c_str(), *old, *now);
  else if (before == nullptr)
    text += "is new, " + (now != nullptr ? joined(elementTexts(key.c_str(), *now)) : shown(after));
  else if (after == nullptr)
    text += "is gone, it was " + (old != nullptr ? joined(elementTexts(key.c_str(), *old)) : shown(before));
  else
    text += shown(before) + " becomes " + shown(after);
  const std::string follows = consequence(key, before, after);
  out.push_back(follows.empty() ? text : text + " (" + follows + ")");
}

// Each key of both but those left out, the new one's first.
void addRules(const std::string& where, const Dictionary& before, const Dictionary& after,
              const std::vector<std::string_view>& leftOut, Lines& out) {
  const auto isLeftOut = [&leftOut](const String& key) {
    return std::find(leftOut.begin(), leftOut.end(), key.view()) != leftOut.end();
  };
  for (const DictionaryEntry& entry : after)
    if (!isLeftOut(entry.key)) addRule(where, entry.key.str(), before.find(entry.key), &entry.value, out);
  for (const DictionaryEntry& entry : before)
    if (!isLeftOut(entry.key) && after.find(entry.key) == nullptr)
      addRule(where, entry.key.str(), &entry.value, nullptr, out);
}

struct Entry {
  std::string name;  // with a number where several have the same
  Dictionary rules;
};

std::vector<Entry> entriesOf(const Dictionary& profile) {
  std::vector<Entry> entries;
  const Array* clients = profile.array("clients");
  if (clients == nullptr) return entries;
  std::vector<std::string> seen;
  for (const Value& element : *clients) {
    const Dictionary* entry = element.dictionary();
    std::string name = entry != nullptr ? storebagEntryName(*entry) : "an entry that is no dictionary";
    const auto same = std::count(seen.begin(), seen.end(), name);
    seen.push_back(name);
    if (same != 0) name += " (its entry " + std::to_string(same + 1) + ")";
    entries.push_back({std::move(name), entry != nullptr ? *entry : Dictionary()});
  }
  return entries;
}

const Entry* entryNamed(const std::vector<Entry>& entries, const std::string& name) {
  for (const Entry& entry : entries)
    if (entry.name == name) return &entry;
  return nullptr;
}

Lines namesIn(const std::vector<Entry>& entries, const std::vector<Entry>& both) {
  Lines names;
  for (const Entry& entry : entries)
    if (entryNamed(both, entry.name) != nullptr) names.push_back(entry.name);
  return names;
}

std::string placeOf(size_t index, size_t count) {
  if (count == 1) return " as the only entry";
  return " at place " + std::to_string(index + 1) + " of " + std::to_string(count);
}

void addClients(const std::string& where, const Dictionary& before, const Dictionary& after, Lines& out) {
  const std::vector<Entry> old = entriesOf(before), now = entriesOf(after);
  for (size_t i = 0; i < now.size(); ++i) {
    const Entry* was = entryNamed(old, now[i].name);
    if (was != nullptr) {
      addRules(where + now[i].name + ", ", was->rules, now[i].rules, {}, out);
      continue;
    }
    out.push_back(where + now[i].name + ": is new" + placeOf(i, now.size()));
    addRules(where + now[i].name + ", ", {}, now[i].rules, {"client", "service", "enabledSince"}, out);
  }
  for (const Entry& entry : old)
    if (entryNamed(now, entry.name) == nullptr)
      out.push_back(where + entry.name +
                    ": is gone (the next entry that fits governs its sessions, if there is one)");
  if (const Lines order = namesIn(now, old); order != namesIn(old, now))
    out.push_back(where + "the order becomes " + joined(order) +
                  " (the first entry that fits governs a session)");
}

void addSection(const std::string& section, const Dictionary& before, const Dictionary& after, Lines& out) {
  for (const DictionaryEntry& entry : after) {
    const std::string where = section + ", " + entry.key.str() + ", ";
    const Dictionary* now = entry.value.dictionary();
    const Dictionary* was = before.dictionary(entry.key);
    if (now == nullptr) {
      addRule(section + ", ", entry.key.str(), before.find(entry.key), &entry.value, out);
      continue;
    }
    if (was == nullptr) out.push_back(section + ", " + entry.key.str() + ": the back end is new");
    addRules(where, was != nullptr ? *was : Dictionary(), *now, {"clients"}, out);
    addClients(where, was != nullptr ? *was : Dictionary(), *now, out);
  }
  for (const DictionaryEntry& entry : before)
    if (after.find(entry.key) == nullptr)
      out.push_back(section + ", " + entry.key.str() + ": the back end is gone");
}

}  // namespace

std::string storebagEntryName(const Dictionary& entry) {
  std::string text = "client " + (entry.contains("client") ? shown(entry.find("client")) : "any");
  if (entry.contains("service")) text += ", service " + shown(entry.find("service"));
  if (entry.contains("enabledSince")) text += ", since " + shown(entry.find("enabledSince"));
  return text;
}

std::vector<std::string> storebagChanges(const Dictionary& before, const Dictionary& after) {
  Lines out;
  addRules("", before, after, {"development", "vantu_internal", "seed", "release"}, out);
  for (const char* section : {"release", "seed", "vantu_internal", "development"}) {
    const Dictionary* was = before.dictionary(section);
    const Dictionary* now = after.dictionary(section);
    if (was != nullptr && now == nullptr) out.push_back(std::string(section) + ": the section is gone");
    if (was == nullptr && now != nullptr) out.push_back(std::string(section) + ": the section is new");
    if (now != nullptr) addSection(section, was != nullptr ? *was : Dictionary(), *now, out);
  }
  return out;
}

}  // namespace kyt::tools
