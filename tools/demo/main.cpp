// kytdemo: the main job from end to end on one machine, behind `./kyt run`. Starts the development server and
// the daemon under a private root, lets real client processes report real events, checks each of them at the
// server, prints what arrived where, and stays up with the page open, and the clients reporting now and then, until Ctrl-C
// (or ends: --once).
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>

#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/linux/service/Process.h"
#include "tools/StorebagFile.h"
#include "tools/demo/Checks.h"
#include "tools/demo/DemoBag.h"
#include "tools/demo/ProgramRun.h"
#include "tools/demo/Stage.h"
#include "tools/demo/Trickle.h"

namespace {

using namespace kyt;
using namespace kyt::tools;

int complain(const std::string& text) {
  std::fprintf(stderr, "kytdemo: %s\n", escapedText(text).c_str());
  return 1;
}

// One client process: kytctl running a scripted session on the daemon's socket.
std::optional<std::string> runClient(Stage& stage, const std::string& name, const std::string& script) {
  const std::string file = stage.folder() + "/" + name + ".session";
  if (auto error = writeFile(file, script, 0644)) return error->localizedDescription;
  ChildProcess::Options how;
  how.outputFile = stage.folder() + "/" + name + ".log";
  how.user = stage.clientUser();
  auto client =
      ChildProcess::start(stage.program("kytctl"), {"session", "--socket", stage.socketPath(), file}, how);
  if (!client) return "kytctl cannot be started";
  const std::optional<int> status = client->wait(std::chrono::seconds(60));
  if (status == 0) return std::nullopt;
  auto said = readFile(how.outputFile);
  return "the client process " + name + " failed: " + (said.index() == 0 ? std::get<std::string>(said) : "");
}

// Of the daemon's process, as the kernel has it.
std::string processStatus(Stage& stage, const std::string& key) {
  std::ifstream status("/proc/" + std::to_string(stage.daemon()->pid()) + "/status");
  for (std::string line; std::getline(status, line);)
    if (line.starts_with(key + ":\t")) return line.substr(key.size() + 2);
  return {};
}

// Another user's daemon has that user's rights alone, and can gain none.
Check checkUser(Stage& stage) {
  const std::string id = std::to_string(stage.daemonUser()->user);
  const std::string ids = processStatus(stage, "Uid"), groups = processStatus(stage, "Groups"),
                    capabilities = processStatus(stage, "CapPrm"),
                    closed = processStatus(stage, "NoNewPrivs");
  return {"the daemon runs as its own user, without capabilities, and can gain none",
          ids == id + "\t" + id + "\t" + id + "\t" + id &&
              groups.find_first_of("0123456789") == std::string::npos &&
              capabilities.find_first_not_of('0') == std::string::npos && closed == "1",
          ids + "; groups " + groups + "; capabilities " + capabilities + "; NoNewPrivs " + closed};
}

Check checkConfined(Stage& stage) {
  const std::string closed = processStatus(stage, "NoNewPrivs"), filter = processStatus(stage, "Seccomp");
  return {"the daemon is confined: it can gain no privileges, and its system calls are filtered",
          closed == "1" && filter == "2", "NoNewPrivs " + closed + "; Seccomp " + filter};
}

// Whether Ctrl-C, or whoever else ends this, came within that time.
bool interruptedWithin(std::chrono::milliseconds time) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(time);
  const timespec most{seconds.count(), std::chrono::nanoseconds(time - seconds).count()};
  return sigtimedwait(&set, nullptr, &most) > 0;
}

void printCommands(Stage& stage) {
  const std::string kytctl = stage.program("kytctl") + " --root " + stage.folder();
  std::printf(
      "\nTwo clients go on reporting until Ctrl-C, which ends all of it. See them come in at %s/ , and try:\n\n",
      stage.httpBase().c_str());
  std::printf("  %s status\n", kytctl.c_str());
  std::printf("  %s watch --bodies       # events as they pass\n", kytctl.c_str());
  std::printf("  %s owner show\n", kytctl.c_str());
  std::printf("  %s consent withdraw     # counts for sessions that begin from then on\n", kytctl.c_str());
  std::printf(
      "  %s explain '{\"Category\":10,\"Type\":1,\"Payload\":{\"secret\":1}}' --client-type 8 --client kytdemo-plain "
      "--service demo --require-user-info\n",
      kytctl.c_str());
  std::printf(
      "  %s send --client-type 20 --category 1 --type 2 --payload '{\"a\":1}' --user-info "
      "'{\"ClientName\":\"example\",\"ServiceName\":\"demo\"}' --require-user-info\n\n",
      kytctl.c_str());
  std::fflush(stdout);
}

std::optional<std::string> goOnUntilInterrupted(Stage& stage) {
  Trickle trickle;
  if (auto problem = trickle.start(stage)) return problem;
  printCommands(stage);
  while (!interruptedWithin(trickle.pause())) trickle.step();
  trickle.finish();
  return std::nullopt;
}

int demonstrate(Stage& stage, bool once) {
  if (auto error = stage.putStorebag("cadmor", demoBag(stage.httpsBase(), "qrs", "kytdemo")))
    return complain(error->localizedDescription);
  if (auto error = stage.putStorebag("dulvek", demoBag(stage.httpsBase(), "httppost", "kytdemo-plain")))
    return complain(error->localizedDescription);
  if (auto error = stage.startDaemon()) return complain(error->localizedDescription);
  if (stage.daemonUser() && stage.clientUser())
    std::printf("users     the daemon runs as %s (%u), its clients as %s (%u)\n",
                stage.daemonUser()->name.c_str(), stage.daemonUser()->user, stage.clientUser()->name.c_str(),
                stage.clientUser()->user);
  std::printf("daemon    socket %s, log %s\nserver    %s, page %s/\n", stage.socketPath().c_str(),
              stage.daemonLog().c_str(), stage.httpsBase().c_str(), stage.httpBase().c_str());
  if (auto problem = runClient(stage, "signed", signedClientScript())) return complain(*problem);
  if (auto problem = runClient(stage, "plain", plainClientScript())) return complain(*problem);
  if (!stage.waitForEvents(kDemoEvents, 30))
    std::printf("not all of %d events arrived within 30 s\n", kDemoEvents);

  int wrong = 0;
  std::vector<Check> checks = checkArrivals(stage);
  checks.push_back(checkConfined(stage));
  if (stage.daemonUser()) checks.push_back(checkUser(stage));
  for (const Check& check : checks) {
    std::printf("%s  %s%s%s\n", check.holds ? "ok   " : "WRONG", check.what.c_str(), check.holds ? "" : ": ",
                check.holds ? "" : escapedText(check.found).c_str());
    if (!check.holds) ++wrong;
  }
  printArrivals(stage);
  if (!once) {
    if (const auto problem = goOnUntilInterrupted(stage)) return complain(*problem);
  }
  const std::optional<int> status = stage.stopDaemon();
  if (status != 0) ++wrong;
  std::printf("%s  the daemon ended with status 0 after SIGTERM\n", status == 0 ? "ok   " : "WRONG");
  return wrong == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  const CommandLine commandLine("kytdemo",
                                "The daemon, the development server and real clients on this machine");
  Stage::Options options;
  options.programs = executableFolder();
  options.share = options.programs + "/../share";
  std::string daemonUser = "daemon", clientUser = "nobody";
  bool once = false, staged = false;
  std::vector<std::string> program;
  commandLine.option("--programs", options.programs, "Folder of the programs, instead of this one's own");
  commandLine.option(
      "--share", options.share,
      "Folder of kytreporting/ with the bundles and the profile, instead of ../share seen from this program");
  commandLine.option("--folder", options.folder,
                     "Lay out here and keep it, instead of in a temporary folder");
  commandLine.option("--daemon-user", daemonUser, "Started by root: whom the daemon runs as").showsDefault();
  commandLine.option("--client-user", clientUser, "Started by root: whom its clients run as").showsDefault();
  commandLine.flag("--once", once, "End after the checks; status 0 only if every event arrived as it should");
  commandLine.flag("--stage", staged,
                   "Run a program instead, and print what became of what it reported: --stage -- PROGRAM …");
  commandLine.option("program", program, "With --stage: the program and its arguments, behind --");
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  if (staged == program.empty()) {
    complain("--stage and a program go together: kytdemo --stage -- PROGRAM …");
    return kWrongUsage;
  }
  if (geteuid() == 0 && !staged) {
    options.daemonUser = User::of(daemonUser);
    options.clientUser = User::of(clientUser);
    if (!options.daemonUser) return complain("there is no user " + daemonUser);
    if (!options.clientUser) return complain("there is no user " + clientUser);
  }
  options.keepFolder = !options.folder.empty();
  options.serverArguments = {"--digest-key", std::string("kytdemo=") + kDemoDigestKeyHex};
  if (staged) {
    auto stage = Stage::make(std::move(options));
    if (auto* error = std::get_if<Error>(&stage)) return complain(error->localizedDescription);
    return runProgramOn(*std::get<std::unique_ptr<Stage>>(stage), program);
  }
  // Children inherit a clean mask; this process takes the two signals when it waits for them.
  if (!once) {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    sigaddset(&set, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
  }
  auto stage = Stage::make(std::move(options));
  if (auto* error = std::get_if<Error>(&stage)) return complain(error->localizedDescription);
  return demonstrate(*std::get<std::unique_ptr<Stage>>(stage), once);
}
