// kytctl status, sessions, books, storebags, log-level, reload: what the daemon says at its administration socket, for
// people in columns, for programs as one JSON object.
#include <algorithm>
#include <cstdio>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/TextEscape.h"
#include "tools/kytctl/Columns.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/StatusText.h"
#include "tools/kytctl/WindowClient.h"
#include "tools/kytctl/WindowOutput.h"

namespace kyt::tools {

namespace {

std::string backEndText(const Dictionary& backEnd, int64_t now) {
  const std::string rule = ruleText(backEnd, now);
  const int64_t posted = numberIn(backEnd, "lastPost"), status = numberIn(backEnd, "lastStatus");
  std::string text =
      textIn(backEnd, "name") + " " + textIn(backEnd, "state") + (rule.empty() ? "" : " by " + rule);
  text += ", " + std::to_string(numberIn(backEnd, "batchedEvents")) + " events in the batch, " +
          std::to_string(numberIn(backEnd, "inFlight")) + " in flight, ";
  if (posted == 0) return text + "no post yet";
  return text + "last post " + clockText(posted, now) +
         (status != 0 ? ": " + std::to_string(status) : ": no answer");
}

void addSession(Columns& columns, const Dictionary& session, int64_t now) {
  const std::string program = textIn(session, "program"), token = textIn(session, "token");
  columns.add({std::to_string(numberIn(session, "pid")), std::to_string(numberIn(session, "user")),
               program.substr(program.rfind('/') + 1), textIn(session, "family"),
               textIn(session, "client") + ":" + textIn(session, "service"),
               spanText(now - numberIn(session, "since")), std::to_string(numberIn(session, "sessionID")),
               token.empty() ? "" : token + " level " + std::to_string(numberIn(session, "level"))});
  const Array* backEnds = session.array("backEnds");
  for (size_t i = 0; backEnds != nullptr && i < backEnds->size(); ++i)
    if (const Dictionary* backEnd = (backEnds->begin() + i)->dictionary())
      columns.addNote(backEndText(*backEnd, now));
}

std::string droppedText(const Dictionary& row) {
  std::string text;
  const Dictionary* reasons = row.dictionary("droppedBy");
  if (reasons == nullptr) return text;
  for (const auto& entry : *reasons)
    text += (text.empty() ? "" : ", ") + entry.key.str() + " " + std::to_string(entry.value.longLongValue());
  return text;
}

}  // namespace

int failedAtWindow(const Error& error) {
  failed(error);
  constexpr int kNotRunning = 3;
  return error.code == WindowClient::kNoDaemon ? kNotRunning : 1;
}

int statusCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto& window = std::get<WindowClient>(client);
  auto status = window.dictionary("Status");
  if (const auto* error = std::get_if<Error>(&status)) return failedAtWindow(*error);
  auto bags = window.dictionaries("Storebags");
  if (const auto* error = std::get_if<Error>(&bags)) return failedAtWindow(*error);
  Dictionary& told = std::get<Dictionary>(status);
  auto& storebags = std::get<std::vector<Dictionary>>(bags);
  if (!json) {
    std::fputs(statusText(told, storebags).c_str(), stdout);
    return 0;
  }
  Array array;
  for (Dictionary& bag : storebags) array.append(std::move(bag));
  told.set("storebags", std::move(array));
  printJSON(told);
  return 0;
}

int sessionsCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto& window = std::get<WindowClient>(client);
  auto status = window.dictionary("Status");
  if (const auto* error = std::get_if<Error>(&status)) return failedAtWindow(*error);
  auto answer = window.dictionaries("Sessions");
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  auto& sessions = std::get<std::vector<Dictionary>>(answer);
  const Dictionary& told = std::get<Dictionary>(status);
  const int64_t all = numberIn(told, "sessions");
  if (json) {
    Value shown = listed("sessions", std::move(sessions));
    shown.mutableDictionary()->set("all", all);
    printJSON(shown);
    return 0;
  }
  Columns columns({{"PID", 7, true},
                   {"USER", 7, true},
                   {"PROGRAM", 14},
                   {"TYPE", 4},
                   {"CLIENT:SERVICE", 22},
                   {"SINCE", 7, true},
                   {"ID", 10, true},
                   {"HIERARCHY", 15}});
  for (const Dictionary& session : sessions) addSession(columns, session, numberIn(told, "now"));
  std::fputs(columns.text().c_str(), stdout);
  if (static_cast<size_t>(all) > sessions.size())
    std::printf("and %lld more\n", static_cast<long long>(all) - static_cast<long long>(sessions.size()));
  return 0;
}

int booksCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto answer = std::get<WindowClient>(client).dictionaries("Books");
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  auto& rows = std::get<std::vector<Dictionary>>(answer);
  if (json) {
    printJSON(listed("rows", std::move(rows)));
    return 0;
  }
  Columns columns({{"USER", 7, true},
                   {"TYPE", 4},
                   {"CLIENT:SERVICE", 26},
                   {"BACK END", 12},
                   {"TAKEN", 9, true},
                   {"PENDING", 8, true},
                   {"DELIVERED", 9, true},
                   {"DROPPED", 9, true}});
  for (const Dictionary& row : rows) {
    const int64_t pending = numberIn(row, "queued") + numberIn(row, "batched") + numberIn(row, "inFlight") +
                            numberIn(row, "waiting") + numberIn(row, "outbox");
    const bool internal = row.boolean("internal");
    columns.add({std::to_string(numberIn(row, "user")), textIn(row, "family"),
                 internal ? "(start and stop)" : textIn(row, "client") + ":" + textIn(row, "service"),
                 textIn(row, "backEnd"), std::to_string(numberIn(row, "taken")), std::to_string(pending),
                 std::to_string(numberIn(row, "delivered")), std::to_string(numberIn(row, "dropped"))});
    if (const std::string why = droppedText(row); !why.empty()) columns.addNote(why);
  }
  std::fputs(columns.text().c_str(), stdout);
  return 0;
}

int storebagsCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto& window = std::get<WindowClient>(client);
  auto status = window.dictionary("Status");
  if (const auto* error = std::get_if<Error>(&status)) return failedAtWindow(*error);
  auto answer = window.dictionaries("Storebags");
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  auto& bags = std::get<std::vector<Dictionary>>(answer);
  if (json) {
    printJSON(listed("storebags", std::move(bags)));
    return 0;
  }
  const int64_t now = numberIn(std::get<Dictionary>(status), "now");
  Columns columns(
      {{"NAME", 16}, {"VERSION IN FORCE", 34}, {"STATE", 8}, {"FETCHED", 16}, {"HOLDS UNTIL", 16}});
  for (const Dictionary& bag : bags) {
    columns.add({textIn(bag, "name"), textIn(bag, "version"), textIn(bag, "state"),
                 clockText(numberIn(bag, "fetched"), now), clockText(numberIn(bag, "expires"), now)});
    columns.addNote(textIn(bag, "address"));
    if (const std::string error = textIn(bag, "lastError"); !error.empty())
      columns.addNote("last error at " + clockText(numberIn(bag, "lastErrorAt"), now) + ": " + error);
  }
  std::fputs(columns.text().c_str(), stdout);
  return 0;
}

int logLevelCommand(const std::string& root, const std::string& level, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto& window = std::get<WindowClient>(client);
  if (!level.empty())
    if (const auto error = window.tell("SetLogLevel", level)) return failedAtWindow(*error);
  auto status = window.dictionary("Status");
  if (const auto* error = std::get_if<Error>(&status)) return failedAtWindow(*error);
  const std::string now = textIn(std::get<Dictionary>(status), "logLevel");
  if (json)
    printJSON(Dictionary{{"logLevel", now}});
  else
    std::printf("%s\n", escapedText(now).c_str());
  return 0;
}

int reloadCommand(const std::string& root, bool json) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto answer = std::get<WindowClient>(client).texts("Reload");
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  Array lines;
  for (const std::string& line : std::get<std::vector<std::string>>(answer)) {
    if (!json) std::printf("%s\n", escapedText(line).c_str());
    lines.append(Value(line));
  }
  if (json) printJSON(Dictionary{{"settings", std::move(lines)}});
  return 0;
}

}  // namespace kyt::tools
