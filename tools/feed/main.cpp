// kytfeed: feeds events to a dashboard server through the dashboard back end's own send, which the daemon
// itself never calls. It reads one JSON object a line and prints the local log line of each event:
//
//   {"method":2,"respCode":3,"event":1,"time":1769860800.25,"message":{"key":"value"}}
//
// Only "method" and "respCode" are required; events are numbered from 1, and happen now. Exit status: 0 when
// everything was handed over and, where acknowledgements are asked for, acknowledged; 1 for a line that is no
// event, for what cannot be read or written, and for events that nobody acknowledged; 2 when there is no back
// end.
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iostream>

#include "platform/base/Semaphore.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/objects/Keys.h"
#include "tools/feed/Event.h"
#include "tools/feed/Machine.h"

namespace kyt::tools {
namespace {

using std::chrono::milliseconds;

constexpr Duration kPoll = milliseconds(2);
// The back end's own end: its next tick, then its last resort. The rest is for a machine that is slow.
constexpr Duration kLastResort = milliseconds(9500), kPatience = std::chrono::seconds(20);
constexpr int kPeriodWithoutProfile = 500;
constexpr size_t kLongestShown = 1024;  // of a line that is no event

struct Options {
  std::string server, file = "-", selfVersion = "8.0", device = std::string(40, '0');
  uint16_t port = 0, clientVersion = 0;
  std::optional<int> reliable;  // milliseconds; the back end takes less than 10 as 10
  int clientType = 0, intervalMilliseconds = 0;
  bool withoutProfile = false;
  uint32_t session = 0;

  [[nodiscard]] bool isReliable() const { return withoutProfile || reliable; }
  [[nodiscard]] Duration period() const {
    return milliseconds(withoutProfile ? kPeriodWithoutProfile : reliable.value_or(kPeriodWithoutProfile));
  }
};

int complain(const std::string& text) {
  std::fprintf(stderr, "kytfeed: %s\n", escapedText(text).c_str());
  return 1;
}

// A socket that took the number of a closed standard stream would get what is printed.
void keepStandardStreams() {
  for (int number = 0; number <= 2; ++number)
    if (::fcntl(number, F_GETFD) < 0)
      static_cast<void>(::open("/dev/null", number == 0 ? O_WRONLY : O_RDONLY));
}

void pauseFor(Duration duration) {
  Semaphore never;
  static_cast<void>(never.waitFor(duration));
}

std::shared_ptr<DashboardBackend> makeBackend(Machine& machine, const Options& options) {
  const auto facts = std::make_shared<SessionFacts>();
  facts->sessionID = options.session;
  facts->compType = options.clientType;
  facts->clientVersion = options.clientVersion;
  facts->udid = String(options.device);
  facts->setSelfVersion(options.selfVersion);
  if (options.withoutProfile)
    return DashboardBackend::initWithName(machine.platform, kKYTReportingBackendDashboard,
                                          std::optional<String>(options.server), options.port, facts);
  Dictionary profile{{"ip", options.server}, {"port", int64_t{options.port}}};
  if (options.reliable) profile.set("reliable", *options.reliable);
  return DashboardBackend::initWithName(machine.platform, kKYTReportingBackendDashboard,
                                        std::optional<Dictionary>(profile), facts);
}

class Feed {
 public:
  Feed(Machine& machine, DashboardBackend& backend) : machine_(machine), backend_(backend) {}

  // Whether the line is an event and its log line could be printed; a complaint says what is wrong otherwise.
  bool send(const std::string& text) {
    ++line_;
    if (text.empty()) return true;
    const auto read = eventFrom(text, machine_.json);
    if (const auto* why = std::get_if<std::string>(&read)) {
      complain("line " + std::to_string(line_) + " is no event: " + *why + ": " +
               text.substr(0, kLongestShown));
      return false;
    }
    const auto& event = std::get<FedEvent>(read);
    number_ = event.number.value_or(static_cast<uint16_t>(number_ + 1));
    const Value line = backend_.sendMessage(event.message, event.time.value_or(machine_.clock.timeOfDay()),
                                            event.method, event.respCode, EventID{number_});
    if (line.string() == nullptr) return false;  // the back end has said why
    ++handedOver_;
    if (std::puts(escapedText(line.string()->view()).c_str()) >= 0 && std::fflush(stdout) == 0) return true;
    complain(std::string("can't write: ") + std::strerror(errno));
    return false;
  }
  [[nodiscard]] uint64_t handedOver() const { return handedOver_; }

 private:
  Machine& machine_;
  DashboardBackend& backend_;
  uint64_t line_ = 0, handedOver_ = 0;
  uint16_t number_ = 0;
};

// The clean-up waits for acknowledgements, and has a last resort of its own.
bool waitForEnd(Machine& machine, const Options& options) {
  const MonotonicTime end = machine.clock.monotonic() + options.period() + kLastResort + kPatience;
  while (machine.udpSockets.openSockets() != 0) {
    if (machine.clock.monotonic() > end) return false;
    pauseFor(kPoll);
  }
  return true;
}

// 0, or 1 after a complaint.
int reportLosses(const Machine& machine, const Options& options, uint64_t handedOver) {
  const uint64_t lost = machine.counters.value(Reason::datagramDisplaced) +
                        machine.counters.value(Reason::datagramUnacknowledged) +
                        machine.counters.value(Reason::datagramGivenUp);
  if (lost == 0) return 0;
  return complain(std::to_string(lost) + " of " + std::to_string(handedOver) + " events " +
                  (options.isReliable() ? "were never acknowledged" : "could not be sent"));
}

// `readError` says why reading ended before the end, or nothing.
template <typename ReadError>
int feed(const Options& options, std::istream& in, ReadError readError) {
  Machine machine;
  if (!machine.reactor) return 2;
  std::shared_ptr<DashboardBackend> backend = makeBackend(machine, options);
  if (!backend) return 2;
  int status = 0;
  Feed fed(machine, *backend);
  errno = 0;
  for (std::string text; status == 0 && std::getline(in, text);) {
    if (!fed.send(text)) status = 1;
    if (status == 0 && options.intervalMilliseconds > 0) pauseFor(milliseconds(options.intervalMilliseconds));
    errno = 0;
  }
  if (status == 0 && readError()) {
    const int why = errno;
    status =
        complain("can't read " + options.file + (why != 0 ? std::string(": ") + std::strerror(why) : ""));
  }
  backend->cleanup();
  backend.reset();
  if (!waitForEnd(machine, options)) return 2;
  machine.end();
  return std::max(status, reportLosses(machine, options, fed.handedOver()));
}

}  // namespace
}  // namespace kyt::tools

int main(int argc, char** argv) {
  using namespace kyt::tools;
  keepStandardStreams();
  Options options;
  const kyt::CommandLine commandLine("kytfeed",
                                     "Feeds events to a dashboard server and prints their local log lines");
  commandLine.option("--server", options.server, "The server's IPv4 address").required();
  commandLine.option("--port", options.port, "Its UDP port").required();
  commandLine.option("--reliable", options.reliable,
                     "Reliable delivery: milliseconds between its ticks; less than 10 counts as 10");
  commandLine.flag("--without-profile", options.withoutProfile,
                   "As a back end without one: reliable, 500 ms");
  commandLine.option("--session", options.session, "The session ID, 32 bits");
  commandLine.option("--client-type", options.clientType, "The client type, 0 to 23");
  commandLine.option("--client-version", options.clientVersion, "The client version, 16 bits");
  commandLine.option("--self-version", options.selfVersion, "The reporting side's version");
  commandLine.option("--device", options.device, "The device identifier; 40 characters are sent");
  commandLine.option("--interval", options.intervalMilliseconds, "Milliseconds between events");
  commandLine.option("events", options.file, "A file with one JSON object a line, or - for standard input");
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  if (options.file == "-") return feed(options, std::cin, [] { return std::ferror(stdin) != 0; });
  std::ifstream file(options.file);
  if (!file) return complain("can't read " + options.file + ": " + std::strerror(errno));
  return feed(options, file, [&file] { return file.bad(); });
}
