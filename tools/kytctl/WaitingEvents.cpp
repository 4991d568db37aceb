#include "tools/kytctl/WaitingEvents.h"

#include <filesystem>
#include <system_error>
#include <utility>
#include <variant>

#include "platform/base/Paths.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/device/DepartureFile.h"
#include "tools/kytctl/Columns.h"
#include "tools/kytctl/StatusText.h"
#include "tools/kytctl/WindowClient.h"

namespace kyt::tools {

namespace {

struct Place {
  const char* key;
  const char* words;
};
constexpr Place kPlaces[] = {{"queued", "being handled"},
                             {"batched", "in the batch"},
                             {"inFlight", "in flight"},
                             {"waiting", "without a network"},
                             {"outbox", "on the disk"}};

int64_t pendingOf(const Dictionary& row) {
  int64_t pending = 0;
  for (const Place& place : kPlaces) pending += numberIn(row, place.key);
  return pending;
}

std::string placesText(const Dictionary& row) {
  std::string text;
  for (const Place& place : kPlaces)
    if (const int64_t events = numberIn(row, place.key); events != 0)
      text += (text.empty() ? "" : ", ") + std::to_string(events) + " " + place.words;
  return row.boolean("internal") ? text + " (start and stop)" : text;
}

}  // namespace

WaitingEvents::WaitingEvents(const std::string& root) {
  const Paths paths = Paths::of(root, "/");
  std::error_code none;
  outbox_ = paths.outbox() + "/outbox.sqlite";
  const auto size = std::filesystem::file_size(outbox_, none);
  if (!none) outboxBytes_ = size;
  daemon_ = DaemonLock::holder(paths.userDefaults());
  posts_ = WaitingPosts::of(root, paths, daemon_ > 0);
  if (daemon_ <= 0) return;
  auto window = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&window)) {
    problem_ = error->localizedDescription;
    return;
  }
  auto books = std::get<WindowClient>(window).dictionaries("Books");
  if (const auto* error = std::get_if<Error>(&books)) {
    problem_ = error->localizedDescription;
    return;
  }
  for (Dictionary& row : std::get<std::vector<Dictionary>>(books))
    if (pendingOf(row) != 0) rows_.push_back(std::move(row));
}

Dictionary WaitingEvents::object() const {
  Array rows;
  for (const Dictionary& row : rows_) {
    Dictionary shown;
    for (const char* key : {"user", "clientType", "client", "service", "backEnd", "internal"})
      if (const Value* value = row.find(key)) shown.set(key, *value);
    for (const Place& place : kPlaces) shown.set(place.key, numberIn(row, place.key));
    rows.append(std::move(shown));
  }
  Dictionary all{{"daemon", daemon_ > 0 ? Value(static_cast<int64_t>(daemon_)) : Value()},
                 {"rows", std::move(rows)},
                 {"outboxBytes", outboxBytes_},
                 {"outbox", posts_.object()}};
  if (!problem_.empty()) all.set("problem", problem_);
  return all;
}

std::string WaitingEvents::text() const {
  std::string text;
  if (daemon_ <= 0)
    text = "Waiting: nothing in memory, the daemon does not run\n";
  else if (!problem_.empty())
    text = "Waiting: the daemon (process " + std::to_string(daemon_) +
           ") has it in memory; how much it is cannot be told: " + escapedText(problem_) + "\n";
  else if (rows_.empty())
    text = "Waiting: nothing, of the daemon that runs (process " + std::to_string(daemon_) + ")\n";
  else
    text = rowsText();
  if (outboxBytes_ != 0)
    text +=
        "Kept on the disk: " + escapedText(outbox_) + ", " + bytesText(outboxBytes_) + "\n" + posts_.text();
  return text;
}

std::string WaitingEvents::rowsText() const {
  Columns columns(
      {{"PROGRAM", 20}, {"SERVICE", 12}, {"TYPE", 4}, {"USER", 7, true}, {"BACK END", 12}, {"EVENTS", 35}});
  for (const Dictionary& row : rows_)
    columns.add({textIn(row, "client"), textIn(row, "service"), std::to_string(numberIn(row, "clientType")),
                 std::to_string(numberIn(row, "user")), textIn(row, "backEnd"), placesText(row)});
  return "Waiting, of the daemon that runs (process " + std::to_string(daemon_) + "):\n\n" + columns.text() +
         "\n";
}

}  // namespace kyt::tools
