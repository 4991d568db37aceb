// kytctl watch: events as they pass, a line each, with what became of them.
#include <cstdint>
#include <cstdio>
#include <string>
#include <string_view>

#include "platform/base/ReportingProgram.h"
#include "platform/base/TextEscape.h"
#include "tools/kytctl/Columns.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/StatusText.h"
#include "tools/kytctl/WindowClient.h"
#include "tools/kytctl/WindowOutput.h"

namespace kyt::tools {

namespace {

constexpr size_t kFateAt = 58;  // characters before the fate

std::string field(std::string_view text, size_t width, bool right = false) {
  std::string shown = cutText(text, width);
  const std::string blanks(width - charactersIn(shown), ' ');
  return (right ? blanks + shown : shown + blanks) + "  ";
}

std::string numberOr(const Dictionary& event, const char* key) {
  return event.find(key) != nullptr ? std::to_string(numberIn(event, key)) : "-";
}

std::string line(const std::string& time, const std::string& user, const std::string& names,
                 const std::string& backEnd, const std::string& kind, const std::string& fate) {
  return field(time, 8) + field(user, 7, true) + field(names, 14) + field(backEnd, 8) + field(kind, 11) +
         cutText(fate, kMostCharacters - kFateAt) + "\n";
}

std::string eventLine(const Dictionary& event) {
  const std::string rule = textIn(event, "rule");
  const int64_t time = numberIn(event, "time"), status = numberIn(event, "status");
  std::string fate = textIn(event, "fate");
  if (!rule.empty()) fate += ": " + rule;
  if (status != 0) fate += ": " + std::to_string(status);
  const bool internal = event.boolean("internal");
  return line(clockText(time, time), std::to_string(numberIn(event, "user")),
              internal ? "(start, stop)" : programText(event), textIn(event, "backEnd"),
              numberOr(event, "category") + "/" + numberOr(event, "type"), fate);
}

// In lines of whole characters.
std::string bodyLines(const Dictionary& event) {
  const std::string body = textIn(event, "body");
  const auto bytes = static_cast<uint64_t>(numberIn(event, "bodyBytes"));
  std::string lines = "    post " + std::to_string(numberIn(event, "post")) + " to " +
                      cutText(textIn(event, "server"), 48) + ", " + bytesText(bytes) +
                      (body.empty()           ? ", not kept"
                       : body.size() != bytes ? ", of which the beginning:"
                                              : ":") +
                      "\n";
  const std::string shown = escapedText(body);
  for (std::string_view rest = shown; !rest.empty();) {
    const std::string_view piece = cutUTF8(rest, kMostCharacters - 4);
    lines.append("    ").append(piece).append("\n");
    rest.remove_prefix(piece.size());
  }
  return lines;
}

void print(const Dictionary& event, bool json) {
  std::string text;
  if (json) {
    text = compactJSON(event) + "\n";
  } else {
    if (const int64_t lost = numberIn(event, "lost"); lost != 0)
      text = "    " + std::to_string(lost) + " were not told: more passed than was read here\n";
    text += eventLine(event);
    if (event.find("bodyBytes") != nullptr) text += bodyLines(event);
  }
  std::fputs(text.c_str(), stdout);
  std::fflush(stdout);
}

}  // namespace

int watchCommand(const std::string& root, const WatchOptions& options) {
  Dictionary filter;
  if (!options.user.empty()) {
    const std::optional<uint32_t> user = userOf(options.user);
    if (!user) return failed("There is no user " + options.user);
    filter.set("user", *user);
  }
  if (options.client) filter.set("client", *options.client);
  if (options.category) filter.set("category", *options.category);
  if (options.bodies) filter.set("bodies", true);
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto& window = std::get<WindowClient>(client);
  if (const auto error = window.watch(filter)) return failedAtWindow(*error);
  if (!options.json) {
    std::fputs(line("TIME", "USER", "CLIENT:SERVICE", "BACK END", "EVENT", "FATE").c_str(), stdout);
    std::fflush(stdout);
  }
  while (std::ferror(stdout) == 0) {
    auto passed = window.nextPassed();
    if (const auto* error = std::get_if<Error>(&passed)) return failedAtWindow(*error);
    print(std::get<Dictionary>(passed), options.json);
  }
  return 1;  // main() says why
}

}  // namespace kyt::tools
