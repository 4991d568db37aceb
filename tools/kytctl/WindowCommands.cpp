// kytctl status, sessions, books, storebags, log-level, reload: what the daemon says at its administration socket, for
// people in columns, for programs as one JSON object.
#include <algorithm>
#include <cstdio>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/ReportingProgram.h"
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
               program.substr(program.rfind('/') + 1), textIn(session, "family"), programText(session),
               spanText(now - numberIn(session, "since")), std::to_string(numberIn(session, "sessionID")),
               token.empty() ? "" : token + " level " + std::to_string(numberIn(session, "level"))});
  const Array* backEnds = session.array("backEnds");
  for (size_t i = 0; backEnds != nullptr && i < backEnds->size(); ++i)
    if (const Dictionary* backEnd = (backEnds->begin() + i)->dictionary())
      columns.addNote(backEndText(*backEnd, now));
}

constexpr size_t kProgramCharacters = 26;
// The user of the row that all users share.
constexpr int64_t kAllUsers = 4294967295;
// Where an event may wait: the key, and what the documents call it.
constexpr std::pair<const char*, const char*> kPlaces[] = {{"queued", "queued"},
                                                           {"batched", "batched"},
                                                           {"inFlight", "in-flight"},
                                                           {"waiting", "waiting"},
                                                           {"outbox", "outbox"}};

std::string droppedText(const Dictionary& row) {
  std::string text;
  const Dictionary* reasons = row.dictionary("droppedBy");
  if (reasons == nullptr) return text;
  for (const auto& entry : *reasons)
    text += (text.empty() ? "" : ", ") + entry.key.str() + " " + std::to_string(entry.value.longLongValue());
  return text;
}

std::string pendingText(const Dictionary& row) {
  std::string text;
  for (const auto& [key, place] : kPlaces)
    if (const int64_t events = numberIn(row, key); events != 0)
      text += (text.empty() ? "" : ", ") + std::string(place) + " " + std::to_string(events);
  return text;
}

// What is too long for its column stands in full beneath: names that begin alike are of different programs.
void addBookRow(Columns& columns, const Dictionary& row) {
  int64_t pending = 0;
  for (const auto& [key, place] : kPlaces) pending += numberIn(row, key);
  const int64_t merged = numberIn(row, "programsMerged"), user = numberIn(row, "user");
  const bool internal = row.boolean("internal");
  const std::string program = programText(row);
  columns.add({user == kAllUsers ? "(all)" : std::to_string(user), textIn(row, "family"),
               internal      ? "(start and stop)"
               : merged != 0 ? "(other programs)"
                             : program,
               textIn(row, "backEnd"), std::to_string(numberIn(row, "taken")), std::to_string(pending),
               std::to_string(numberIn(row, "delivered")), std::to_string(numberIn(row, "dropped"))});
  constexpr size_t kNoteBytes = 90;
  if (merged != 0) {
    columns.addNote("of " + std::to_string(merged) + " programs, or more, without rows of their own");
  } else if (cutText(program, kProgramCharacters) != program) {
    for (std::string_view rest = program; !rest.empty(); rest.remove_prefix(cutUTF8(rest, kNoteBytes).size()))
      columns.addNote(cutUTF8(rest, kNoteBytes));
  }
  if (pending != 0) columns.addNote("pending: " + pendingText(row));
  if (const std::string why = droppedText(row); !why.empty()) columns.addNote(why);
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
                   {"CLIENT:SERVICE", kProgramCharacters},
                   {"BACK END", 12},
                   {"TAKEN", 9, true},
                   {"PENDING", 8, true},
                   {"DELIVERED", 9, true},
                   {"DROPPED", 9, true}});
  for (const Dictionary& row : rows) addBookRow(columns, row);
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
    if (!json) std::fputs(foldedText(line).c_str(), stdout);
    lines.append(Value(line));
  }
  if (json) printJSON(Dictionary{{"settings", std::move(lines)}});
  return 0;
}

}  // namespace kyt::tools
