#include "tools/demo/ProgramRun.h"

#include <chrono>
#include <cstdio>
#include <cstring>
#include <variant>

#include "platform/base/TextEscape.h"
#include "platform/linux/data/RapidJSON.h"
#include "tools/StorebagFile.h"
#include "tools/demo/Checks.h"
#include "tools/demo/DemoBag.h"
#include "tools/demo/Stage.h"

namespace kyt::tools {

namespace {

constexpr std::chrono::seconds kSettled{20};  // for what the program left to the daemon

int complain(const std::string& text) {
  std::fprintf(stderr, "kytdemo: %s\n", escapedText(text).c_str());
  return 1;
}

std::optional<ChildProcess> askBooks(Stage& stage, bool json, const std::string& file) {
  std::vector<std::string> arguments = {"--root", stage.folder(), "books"};
  if (json) arguments.emplace_back("--json");
  ChildProcess::Options how;
  how.outputFile = file;
  return ChildProcess::start(stage.program("kytctl"), arguments, how);
}

// Whether the daemon has events that it has neither delivered nor dropped.
bool anyPending(const Value& books) {
  const Dictionary* top = books.dictionary();
  const Array* rows = top != nullptr ? top->array("rows") : nullptr;
  if (rows == nullptr) return true;
  for (const Value& row : *rows) {
    const Dictionary* figures = row.dictionary();
    if (figures == nullptr) continue;
    for (const char* state : {"queued", "batched", "inFlight", "waiting"})
      if (figures->integer(state) != 0) return true;
  }
  return false;
}

bool settled(Stage& stage) {
  const std::string file = stage.folder() + "/books.json";
  std::remove(file.c_str());
  auto kytctl = askBooks(stage, true, file);
  if (!kytctl || kytctl->wait(kSettled) != 0) return false;
  auto text = readFile(file);
  if (text.index() != 0) return false;
  RapidJSON json;
  auto books = json.parse(std::get<std::string>(text));
  return std::holds_alternative<Value>(books) && !anyPending(std::get<Value>(books));
}

std::optional<Error> putBags(Stage& stage) {
  for (const char* name : kStorebagNames)
    if (auto error = stage.putStorebag(name, openBag(stage.httpsBase()))) return error;
  return std::nullopt;
}

}  // namespace

int runProgramOn(Stage& stage, const std::vector<std::string>& program) {
  if (auto error = putBags(stage)) return complain(error->localizedDescription);
  if (auto error = stage.startDaemon()) return complain(error->localizedDescription);
  ChildProcess::Options how;
  how.environment = {{"KYTREPORTING_SOCKET", stage.socketPath()}};
  auto child =
      ChildProcess::start(program.front(), std::vector<std::string>(program.begin() + 1, program.end()), how);
  if (!child) return complain(program.front() + ": " + std::strerror(errno));
  std::optional<int> status;
  while (!status) status = child->wait(std::chrono::hours(1));
  if (!waitUntil(kSettled, [&stage] { return settled(stage); }))
    complain("the daemon still has events of it");
  printArrivals(stage);
  std::printf("\nwhat became of what was reported, by the daemon's books:\n");
  std::fflush(stdout);
  if (auto books = askBooks(stage, false, {}); books) (void)books->wait(kSettled);
  std::printf("\nthe program ended with status %d\n", *status);
  if (stage.stopDaemon() != 0) return complain("the daemon did not end in order, see its log");
  return *status;
}

}  // namespace kyt::tools
