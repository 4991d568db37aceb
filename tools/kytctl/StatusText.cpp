#include "tools/kytctl/StatusText.h"

#include <algorithm>
#include <cstdio>
#include <utility>

#include "tools/kytctl/Columns.h"

namespace kyt::tools {

namespace {

constexpr size_t kMostReasons = 6;  // shown by name
constexpr size_t kLabel = 15;       // characters

// One line with a label before it, cut to what fits.
void addLine(std::string& out, const std::string& label, const std::string& text) {
  std::string padded = label;
  padded.resize(kLabel, ' ');
  out += padded + cutText(text, kMostCharacters - kLabel) + "\n";
}

// "1 session", "2 sessions".
std::string countText(int64_t count, const char* what) {
  return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

std::string percent(int64_t part, int64_t whole) {
  if (whole <= 0) return "";
  char text[16];
  std::snprintf(text, sizeof text, " (%.1f %%)",
                100.0 * static_cast<double>(part) / static_cast<double>(whole));
  return text;
}

// The largest first.
std::vector<std::pair<std::string, int64_t>> reasonsOf(const Dictionary& fates) {
  std::vector<std::pair<std::string, int64_t>> reasons;
  if (const Dictionary* by = fates.dictionary("droppedBy"))
    for (const auto& entry : *by) reasons.emplace_back(entry.key.str(), entry.value.longLongValue());
  std::stable_sort(reasons.begin(), reasons.end(),
                   [](const auto& a, const auto& b) { return a.second > b.second; });
  return reasons;
}

void addFates(std::string& out, const std::string& label, const Dictionary& fates, const std::string& more) {
  const int64_t delivered = numberIn(fates, "delivered"), dropped = numberIn(fates, "dropped");
  addLine(out, label,
          std::to_string(delivered) + " delivered, " + std::to_string(dropped) + " dropped" +
              percent(dropped, delivered + dropped) + more);
}

// Whether it works, as far as the last hour says.
std::string verdict(const Dictionary& lastHour, int64_t pending) {
  const int64_t delivered = numberIn(lastHour, "delivered"), dropped = numberIn(lastHour, "dropped");
  if (delivered > 0) return "yes, " + std::to_string(delivered) + " left in the last hour";
  if (dropped == 0 && pending == 0) return "nothing was to be sent in the last hour";
  if (dropped == 0) return "nothing left in the last hour, " + std::to_string(pending) + " pending";
  const auto reasons = reasonsOf(lastHour);
  return "no, nothing left in the last hour, and " + std::to_string(dropped) + " did not" +
         (reasons.empty() ? "" : ": most for " + reasons.front().first);
}

void addReasons(std::string& out, const Dictionary& fates) {
  size_t shown = 0;
  for (const auto& [reason, events] : reasonsOf(fates)) {
    if (shown++ == kMostReasons) return addLine(out, "", "  further reasons: kytctl books");
    addLine(out, "", "  " + std::to_string(events) + " " + reason);
  }
}

void addBackEnds(std::string& out, const Dictionary& status, int64_t now) {
  const Array* backEnds = status.array("backEnds");
  std::string label = "back ends";
  for (size_t i = 0; backEnds != nullptr && i < backEnds->size(); ++i) {
    const Dictionary* backEnd = (backEnds->begin() + i)->dictionary();
    if (backEnd == nullptr) continue;
    const std::string rule = ruleText(*backEnd, now);
    addLine(out, std::exchange(label, ""),
            textIn(*backEnd, "family") + " " + textIn(*backEnd, "name") + " " + textIn(*backEnd, "state") +
                (rule.empty() ? "" : " by " + rule) + ", in " +
                countText(numberIn(*backEnd, "sessions"), "session"));
  }
}

void addStorebags(std::string& out, const std::vector<Dictionary>& storebags, int64_t now) {
  std::string label = "storebags";
  for (const Dictionary& bag : storebags) {
    const std::string version = textIn(bag, "version"), state = textIn(bag, "state");
    addLine(out, std::exchange(label, ""),
            textIn(bag, "name") + (version.empty() ? " none in force" : " version " + version + " in force") +
                ", is asked for again at " + clockText(numberIn(bag, "expires"), now) +
                (state == "good" ? "" : ", " + state + ": " + textIn(bag, "lastError")));
  }
  if (storebags.empty()) addLine(out, label, "none was asked for");
}

void addServers(std::string& out, const Dictionary& status, int64_t now) {
  const Array* servers = status.array("servers");
  std::string label = "servers";
  for (size_t i = 0; servers != nullptr && i < servers->size(); ++i) {
    const Dictionary* server = (servers->begin() + i)->dictionary();
    if (server == nullptr) continue;
    const int64_t answered = numberIn(*server, "lastAnswer"), errorAt = numberIn(*server, "lastErrorAt");
    std::string text = textIn(*server, "address");
    text += answered != 0
                ? ": " + std::to_string(numberIn(*server, "lastStatus")) + " at " + clockText(answered, now)
                : ": never answered";
    addLine(out, std::exchange(label, ""), text);
    if (errorAt != 0)
      addLine(out, "", "  last error at " + clockText(errorAt, now) + ": " + textIn(*server, "lastError"));
  }
}

}  // namespace

int64_t numberIn(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr ? value->longLongValue() : 0;
}

std::string textIn(const Dictionary& dictionary, const char* key) {
  const String* text = dictionary.string(key);
  return text != nullptr ? text->str() : std::string();
}

std::string ruleText(const Dictionary& backEnd, int64_t now) {
  std::string rule = textIn(backEnd, "rule");
  if (rule == "none") return "";
  if (rule != "5xx") return rule;
  return std::to_string(numberIn(backEnd, "status")) + " at " + clockText(numberIn(backEnd, "decided"), now);
}

std::string statusText(const Dictionary& status, const std::vector<Dictionary>& storebags) {
  const int64_t now = numberIn(status, "now"), since = numberIn(status, "since");
  std::string out;
  addLine(out, "kytreportingd",
          textIn(status, "version") + ", process " + std::to_string(numberIn(status, "pid")) +
              ", runs since " + clockText(since, now) + " (" + spanText(now - since) + "), log level " +
              textIn(status, "logLevel"));
  addLine(out, "uses",
          bytesText(static_cast<uint64_t>(numberIn(status, "memoryBytes"))) + ", " +
              std::to_string(numberIn(status, "threads")) + " threads");
  addLine(out, "clients",
          countText(numberIn(status, "sessions"), "session") + ", " +
              countText(numberIn(status, "connections"), "connection"));
  if (const Dictionary* lastHour = status.dictionary("lastHour")) {
    addLine(out, "working", verdict(*lastHour, numberIn(status, "pending")));
    addFates(out, "last hour", *lastHour, "");
    addReasons(out, *lastHour);
  }
  addFates(out, "all", status,
           ", " + std::to_string(numberIn(status, "pending")) + " pending of " +
               std::to_string(numberIn(status, "taken")) + " taken");
  addReasons(out, status);
  addBackEnds(out, status, now);
  addStorebags(out, storebags, now);
  addServers(out, status, now);
  return out;
}

}  // namespace kyt::tools
