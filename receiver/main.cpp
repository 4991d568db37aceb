// kytreceiver: takes a fleet's posts of events and puts them into a distributed log.
#include <sys/resource.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/linux/base/StopSignals.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/linux/service/LogSinks.h"
#include "receiver/Receiver.h"
#include "receiver/SpoolContents.h"
#include "receiver/kafka/KafkaLog.h"
#include "receiver/nats/NatsLog.h"

namespace kyt::receiver {
namespace {

struct Arguments {
  std::string config = "/etc/kytreceiver/kytreceiver.toml";
  std::string level = "default";
  std::string readyFile;
  std::string check = "headers";
  int refuseWith = 429;
  bool checkConfig = false, makeStreams = false, updateStreams = false, listSpool = false;
  int removeFromSpool = 0;
};

void raiseDescriptorLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
}

// Where the service manager connected standard error with the journal, the lines go there with their fields.
LogTarget logTarget() {
  return std::getenv("JOURNAL_STREAM") != nullptr ? LogTarget::automatic : LogTarget::standardError;
}

int fail(const std::string& text) {
  std::fprintf(stderr, "kytreceiver: %s\n", text.c_str());
  return 1;
}

int makeStreams(const Settings& settings, bool updates, Log& lines) {
  NatsLog log(settings.log, lines);
  const StreamsMade made = log.makeStreams(updates);
  if (made.problem) return fail(*made.problem);
  for (const std::string& difference : made.differences)
    std::fprintf(stderr, "kytreceiver: %s\n", difference.c_str());
  if (!made.differences.empty())
    return fail(
        "nothing was changed of what is there; --update-streams does that, and what is older than "
        "log.max_age_seconds then leaves at once");
  std::printf("The streams \"%s\" and \"kyt-dead-letters\" are there, as the settings say.\n",
              settings.log.stream.c_str());
  return 0;
}

int listSpool(const Settings& settings) {
  const auto found = postsOfSpool(settings);
  if (const auto* wrong = std::get_if<std::string>(&found)) return fail(*wrong);
  for (const SpooledPost& post : std::get<std::vector<SpooledPost>>(found)) {
    const std::time_t keptAt = post.keptAt;
    std::tm utc{};
    char time[32] = "";
    std::strftime(time, sizeof time, "%Y-%m-%dT%H:%M:%SZ", ::gmtime_r(&keptAt, &utc));
    if (post.id.empty())
      std::printf("%lld the disk does not give it\n", static_cast<long long>(post.number));
    else
      std::printf("%lld %s %s %llu bytes %s\n", static_cast<long long>(post.number), post.id.c_str(), time,
                  static_cast<unsigned long long>(post.bytes), post.sender.c_str());
  }
  // Who redirects it to a file would take a part for the whole.
  if (std::fflush(stdout) != 0 || std::ferror(stdout) != 0) return fail("can't write the output");
  return 0;
}

int run(const Settings& settings, const Arguments& arguments) {
  StopSignals signals;
  if (signals.error() != 0) return fail(std::strerror(signals.error()));
  raiseDescriptorLimit();
  Counters counters;
  const std::unique_ptr<LogSink> sink = makeLogSink(logTarget(), counters, "kytreceiver");
  sink->allowThreads();
  Log lines(*sink, arguments.level == "debug"   ? LogLevel::debug
                   : arguments.level == "error" ? LogLevel::error
                                                : LogLevel::normal);
  const bool isKafka = settings.log.kind == LogKind::kafka;
  const bool makesStreams = arguments.makeStreams || arguments.updateStreams;
  if (makesStreams && isKafka) return fail("topics are made with the tools of their servers");
  if (makesStreams) return makeStreams(settings, arguments.updateStreams, lines);
  ReceiverOptions options;
  options.posts.refuseWith = static_cast<unsigned>(arguments.refuseWith);
  options.posts.opensPosts = arguments.check == "full";
  options.readyFile = arguments.readyFile;
  if (isKafka) {
    KafkaLog log(settings.log, lines);
    if (const auto wrong = log.open()) return fail("[log]: " + *wrong);
    return runReceiver(settings, options, log, signals, lines);
  }
  NatsLog log(settings.log, lines);
  return runReceiver(settings, options, log, signals, lines);
}

}  // namespace
}  // namespace kyt::receiver

int main(int argc, char** argv) {
  using namespace kyt::receiver;
  Arguments arguments;
  const kyt::CommandLine commandLine(
      "kytreceiver", "Takes a fleet's posts of events, checks them, and puts them into a replicated log");
  commandLine.option("--config", arguments.config, "The settings").showsDefault();
  commandLine.flag("--check-config", arguments.checkConfig, "Say what is wrong with the settings, and end");
  commandLine.flag("--make-streams", arguments.makeStreams,
                   "Make the streams that are missing in the log, say what differs of the others, and end");
  commandLine.flag("--update-streams", arguments.updateStreams,
                   "The same, but change the others too: what is too old leaves at once");
  commandLine.flag("--list-spool", arguments.listSpool,
                   "Print the posts of the spool, a line each, and end; no receiver may have it");
  commandLine
      .option("--remove-from-spool", arguments.removeFromSpool,
              "Remove the post with that number from the spool for good, and end")
      .between(1, 2147483647);
  commandLine
      .option("--check", arguments.check,
              "What is looked at of each post; full: it is opened, and its JSON must be good")
      .oneOf({"headers", "full"})
      .showsDefault();
  commandLine
      .option("--refuse-with", arguments.refuseWith,
              "What a post gets that neither log nor spool can take; 503 switches devices off")
      .between(429, 503)
      .showsDefault();
  commandLine.option("--log-level", arguments.level, "From which level on lines are logged")
      .oneOf({"debug", "default", "error"})
      .showsDefault();
  commandLine.option("--ready-file", arguments.readyFile,
                     "Written when the ports are open: their numbers as JSON");
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  if (arguments.refuseWith != 429 && arguments.refuseWith != 503) {
    std::fprintf(stderr, "kytreceiver: --refuse-with takes 429 or 503\n");
    return kyt::kWrongUsage;
  }
  const auto settings = readSettings(arguments.config);
  if (const auto* errors = std::get_if<SettingsErrors>(&settings)) {
    for (const std::string& line : errors->lines) std::fprintf(stderr, "kytreceiver: %s\n", line.c_str());
    return 1;
  }
  if (arguments.checkConfig) return 0;
  if (arguments.listSpool) return listSpool(std::get<Settings>(settings));
  if (arguments.removeFromSpool != 0) {
    const auto wrong = removeFromSpool(std::get<Settings>(settings), arguments.removeFromSpool);
    return wrong ? fail(*wrong) : 0;
  }
  return run(std::get<Settings>(settings), arguments);
}
