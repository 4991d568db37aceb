// kytreader: takes posts out of the log and puts them into PostgreSQL, each once. It acknowledges to the log what the
// database has committed, and nothing before: whenever this program ends, nothing is lost, and what comes again is known by
// its ID. Any number of readers of one consumer share the work.
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <string>
#include <thread>

#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "reader/Stream.h"
#include "reader/Table.h"

namespace {

using namespace kyt;
using namespace kyt::reader;

std::atomic<bool> isStopping{false};

void stop(int /*signal*/) {
  isStopping = true;
}

void say(const std::string& text) {
  std::fprintf(stderr, "kytreader: %s\n", escapedText(text).c_str());
}

// Between attempts: half a second, or less where this program is to end.
void rest() {
  for (int i = 0; i < 10 && !isStopping; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(50));
}

// Until it works or this program is to end; says what is wrong once for each reason.
template <typename Work>
bool untilDone(Work work) {
  std::string said;
  while (!isStopping) {
    const std::optional<std::string> problem = work();
    if (!problem) return true;
    if (*problem != said) say(*problem);
    said = *problem;
    rest();
  }
  return false;
}

void run(Stream& stream, Table& table) {
  if (!untilDone([&] { return table.open(); }) || !untilDone([&] { return stream.open(); })) return;
  say("reading");
  Stored stored;
  std::optional<std::string> problem;
  std::string said;
  while (!isStopping) {
    const std::vector<Post> posts = stream.next(std::chrono::milliseconds(500), problem);
    if (problem && *problem != said) say(*problem);
    said = problem.value_or("");
    if (problem) {
      rest();
      if (!untilDone([&] { return stream.open(); })) break;
    }
    if (posts.empty()) continue;
    const bool isStored = untilDone([&] {
      auto failed = table.store(posts, stored);
      if (failed) static_cast<void>(table.open());
      return failed;
    });
    if (!isStored) break;
    if (const auto unacknowledged = stream.acknowledge()) say(*unacknowledged);
  }
  say(std::to_string(stored.posts) + " posts stored, " + std::to_string(stored.repeats) +
      " repeats left out, " + std::to_string(stored.unreadable) + " that cannot be read set aside");
}

}  // namespace

int main(int argc, char** argv) {
  StreamOptions options;
  std::string database;
  const CommandLine commandLine("kytreader", "Takes posts out of the log and puts them into PostgreSQL");
  commandLine
      .option("--server", options.servers, "A server of the log, as nats://127.0.0.1:4222; may be repeated")
      .required()
      .repeatable();
  commandLine.option("--stream", options.stream, "The stream that the receivers fill").showsDefault();
  commandLine.option("--durable", options.durable, "The consumer's name; readers of one name share the work")
      .showsDefault();
  commandLine.option("--batch", options.batch, "Posts in one transaction, at most")
      .between(1, 10000)
      .showsDefault();
  commandLine
      .option("--acknowledge-within", options.acknowledgeWithin,
              "Seconds after which the log gives out again what a reader took and did not acknowledge")
      .between(1, 3600)
      .showsDefault();
  commandLine.option("--database", database, "PostgreSQL, as \"host=/run/postgresql dbname=kyt\"").required();
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  std::signal(SIGTERM, stop);
  std::signal(SIGINT, stop);
  Stream stream(options);
  Table table(database);
  run(stream, table);
  return 0;
}
