// kytfleet: a fleet's receiving end on one machine, behind `./kyt fleet`. Starts nginx, two receivers, a log of three nodes,
// the reader, PostgreSQL and a daemon; lets real clients report; and checks that each event stands in the table once. Then
// it stays up, with figures each two seconds, until Ctrl-C (or ends: --once).
#include <signal.h>
#include <unistd.h>

#include <cstdio>

#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/linux/service/Process.h"
#include "tools/StorebagFile.h"
#include "tools/demo/DemoBag.h"
#include "tools/demo/Trickle.h"
#include "tools/fleet/Fleet.h"

namespace {

using namespace kyt;
using namespace kyt::tools;

// Besides the demonstration's two clients, with a start and a stop of its session.
constexpr int kManyEvents = 500;
constexpr int kEvents = kDemoEvents + kManyEvents + 2;

int complain(const std::string& text) {
  std::fprintf(stderr, "kytfleet: %s\n", escapedText(text).c_str());
  return 1;
}

std::string manyScript() {
  return openingSteps({"kytdemo-plain", 8}, 7100) + R"({"do":"send","category":12,"type":1,"repeat":)" +
         std::to_string(kManyEvents) + ",\"payload\":{\"many\":true}}\n{\"do\":\"finish\"}\n";
}

std::optional<std::string> runClient(Stage& stage, const std::string& name, const std::string& script) {
  const std::string file = stage.folder() + "/" + name + ".session";
  if (auto error = writeFile(file, script, 0644)) return error->localizedDescription;
  ChildProcess::Options how;
  how.outputFile = stage.folder() + "/" + name + ".log";
  how.user = stage.clientUser();
  auto client =
      ChildProcess::start(stage.program("kytctl"), {"session", "--socket", stage.socketPath(), file}, how);
  if (!client) return "kytctl cannot be started";
  if (client->wait(std::chrono::seconds(60)) == 0) return std::nullopt;
  auto said = readFile(how.outputFile);
  return "the client process " + name + " failed: " + (said.index() == 0 ? std::get<std::string>(said) : "");
}

std::string line(std::string text) {
  while (!text.empty() && text.back() == '\n') text.pop_back();
  return text;
}

// Whether something is as it should be, told.
bool check(const char* what, const std::string& found, const std::string& wanted) {
  std::printf("%s  %s%s%s\n", found == wanted ? "ok   " : "WRONG", what, found == wanted ? "" : ": ",
              found == wanted ? "" : escapedText(found).c_str());
  return found == wanted;
}

bool checkTable(Fleet& fleet) {
  Postgres& table = fleet.postgres();
  const std::string all = std::to_string(kEvents);
  static_cast<void>(waitUntil(std::chrono::seconds(60),
                              [&] { return line(table.query("SELECT count(*) FROM kyt_events")) == all; }));
  bool isGood =
      check("each event stands in the table", line(table.query("SELECT count(*) FROM kyt_events")), all);
  isGood &= check("each once: no record is there twice",
                  line(table.query("SELECT count(DISTINCT record) FROM kyt_events")), all);
  isGood &=
      check("each post of the client that signs came with a good digest, and no other with one",
            line(table.query("SELECT string_agg(DISTINCT client || ' ' || digest, ', ') FROM kyt_posts")),
            "kytdemo valid, kytdemo-plain absent");
  isGood &=
      check("what may not leave did not: 'secret' is gone, 'account' is hashed",
            line(table.query("SELECT count(*) FILTER (WHERE record ? 'secret'), count(DISTINCT record ->> "
                             "'account') FROM kyt_events")),
            "0|1");
  isGood &= check("nothing was unreadable", line(table.query("SELECT count(*) FROM kyt_unreadable")), "0");
  const std::string posts = line(table.query("SELECT count(*) FROM kyt_posts"));
  char answered[32];
  std::snprintf(answered, sizeof answered, "%.0f",
                fleet.sum("kyt_posts_total{result=\"stored\"}") +
                    fleet.sum("kyt_posts_total{result=\"spooled\"}") - fleet.sum("kyt_duplicates_total"));
  isGood &= check("as many posts stand in the table as receivers answered with 200", posts, answered);
  std::printf("       %s events in %s posts\n", all.c_str(), posts.c_str());
  return isGood;
}

void printServers(Fleet& fleet) {
  std::printf("front     %s (nginx), which passes on to %zu receivers\n", fleet.front().base().c_str(),
              fleet.receivers());
  const std::optional<size_t> leader = fleet.leader();
  std::printf("log       %zu nodes of NATS JetStream, 3 replicas, led by %s\n", fleet.nodes(),
              leader ? ("log-" + std::to_string(*leader + 1)).c_str() : "nobody yet");
  std::printf("table     psql \"%s\"   (kyt_posts, kyt_events, kyt_unreadable)\n",
              fleet.postgres().database().c_str());
  std::printf("daemon    socket %s\nlogs      in %s\n", fleet.stage().socketPath().c_str(),
              fleet.folder().c_str());
  std::fflush(stdout);
}

void printFigures(Fleet& fleet) {
  std::printf("posts %.0f stored, %.0f spooled, %.0f repeats; spool %.0f; nodes",
              fleet.sum("kyt_posts_total{result=\"stored\"}"),
              fleet.sum("kyt_posts_total{result=\"spooled\"}"), fleet.sum("kyt_duplicates_total"),
              fleet.sum("kyt_spool_posts"));
  const std::optional<size_t> leader = fleet.leader();
  for (size_t i = 0; i < fleet.nodes(); ++i)
    std::printf(" %s", !fleet.isNodeRunning(i) ? "away" : leader == i ? "leads" : "follows");
  std::printf("; table %s events\n", line(fleet.postgres().query("SELECT count(*) FROM kyt_events")).c_str());
  std::fflush(stdout);
}

bool interruptedWithin(std::chrono::milliseconds time) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(time);
  const timespec most{seconds.count(), std::chrono::nanoseconds(time - seconds).count()};
  return sigtimedwait(&set, nullptr, &most) > 0;
}

std::optional<std::string> goOnUntilInterrupted(Fleet& fleet) {
  Trickle trickle;
  if (auto problem = trickle.start(fleet.stage())) return problem;
  std::printf("\nTwo clients go on reporting until Ctrl-C, which ends all of it.\n\n");
  auto next = std::chrono::steady_clock::now();
  while (!interruptedWithin(trickle.pause())) {
    trickle.step();
    if (std::chrono::steady_clock::now() < next) continue;
    printFigures(fleet);
    next = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  }
  trickle.finish();
  return std::nullopt;
}

int demonstrate(Fleet& fleet, bool once) {
  printServers(fleet);
  Stage& stage = fleet.stage();
  if (auto error = stage.startDaemon()) return complain(error->localizedDescription);
  for (const auto& [name, script] :
       {std::pair("signed", signedClientScript()), std::pair("plain", plainClientScript()),
        std::pair("many", manyScript())})
    if (auto problem = runClient(stage, name, script)) return complain(*problem);
  bool isGood = checkTable(fleet);
  if (!once)
    if (const auto problem = goOnUntilInterrupted(fleet)) return complain(*problem);
  const std::optional<int> status = stage.stopDaemon();
  isGood &= check("the daemon ended with status 0 after SIGTERM", std::to_string(status.value_or(-1)), "0");
  return isGood ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  const CommandLine commandLine("kytfleet", "A fleet's receiving end on this machine");
  FleetOptions options;
  options.stage.programs = executableFolder();
  bool once = false;
  commandLine.option("--programs", options.stage.programs,
                     "Folder of the programs, instead of this one's own");
  commandLine
      .option("--share", options.stage.share, "Folder of kytreporting/ with the bundles and the profile")
      .required();
  commandLine.option("--site", options.site, "The site for nginx").required();
  commandLine.flag("--once", once,
                   "End after the checks; status 0 only if each event stands in the table once");
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  if (geteuid() == 0) {
    options.stage.daemonUser = User::of("daemon");
    options.stage.clientUser = User::of("nobody");
  }
  if (!once) {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    sigaddset(&set, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
  }
  auto fleet = Fleet::start(std::move(options));
  if (auto* error = std::get_if<Error>(&fleet)) return complain(error->localizedDescription);
  return demonstrate(*std::get<std::unique_ptr<Fleet>>(fleet), once);
}
