// kytfeed: feeds events to a dashboard server through the dashboard back end's own send, which the daemon
// itself never calls. It reads one JSON object a line and prints the local log line of each event:
//
//   {"method":2,"respCode":3,"event":1,"time":1769860800.25,"message":{"key":"value"}}
//
// Only "method" and "respCode" are required; events are numbered from 1, and happen now. Exit status: 0 when
// everything was handed over and the back end has ended, 1 for a line that is none, 2 when there is no back
// end.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <iostream>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/Counters.h"
#include "platform/Keys.h"
#include "platform/Limits.h"
#include "platform/Platform.h"
#include "platform/Semaphore.h"
#include "platform/System.h"
#include "platform/TextEscape.h"
#include "platform/WorkerPool.h"
#include "platform/linux/LinuxMemoryInfo.h"
#include "platform/linux/LinuxRandom.h"
#include "platform/linux/OpenSSLCryptography.h"
#include "platform/linux/PugixmlPropertyLists.h"
#include "platform/linux/RapidJSONWriter.h"
#include "platform/linux/ZlibDeflate.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/LinuxUDPSocket.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/linux/system/DlopenPluginBundles.h"
#include "platform/linux/system/JournalPowerLog.h"
#include "platform/linux/system/LinuxDeviceProperties.h"
#include "platform/linux/system/LinuxFileExtensions.h"
#include "platform/linux/system/LogSinks.h"
#include "platform/linux/system/TomlUserDefaults.h"
#include "platform/linux/url/CurlUrlSession.h"

namespace kyt::tools {
namespace {

constexpr Duration kPoll = std::chrono::milliseconds(2);
constexpr Duration kLongestEnd =
    std::chrono::seconds(30);  // the back end's own last resort comes far earlier

constexpr size_t kLongestShown = 1024;  // of a line that is no event

struct Options {
  std::string server, file = "-", selfVersion = "8.0", device = std::string(40, '0');
  uint16_t port = 0, clientVersion = 0;
  int reliable = 0, clientType = 0, intervalMilliseconds = 0;
  bool withoutProfile = false;
  uint32_t session = 0;
};

class NoBundle final : public Bundle {
 public:
  std::optional<String> version() override { return std::nullopt; }
  std::optional<Data> resource(std::string_view, std::string_view) override { return std::nullopt; }
};

// The real adapters of this machine. What a dashboard back end never asks for is there all the same, since
// every back end is made with all ports; nothing is stored anywhere.
struct Machine {
  StderrSink sink;
  Log log{sink};
  Limits limits;
  Counters counters;
  LinuxClock clock;
  std::unique_ptr<EpollReactor> reactor = EpollReactor::create();
  WorkerPool workers{WorkerPoolOptions{}};
  LinuxRandom random;
  LinuxMemoryInfo memory;
  OpenSSLCryptography cryptography;
  PugixmlPropertyLists propertyLists;
  RapidJSONWriter json;
  ZlibDeflate deflate;
  TomlUserDefaults userDefaults{{"/nonexistent"}, log, counters, clock};
  LinuxDeviceProperties deviceProperties{DeviceSources{}, cryptography, log, clock};
  DefaultsDiagnosticsConsent consent{userDefaults};
  CurlURLSessionFactory urlSessions{CurlURLSessionOptions{}, log, counters};
  LinuxUDPSocketFactory udpSockets;
  NoBundle bundle;
  LinuxFileExtensions fileExtensions{nullptr, log, counters};
  DlopenPluginBundles pluginBundles{"/nonexistent", log};
  JournalPowerLog powerLog{counters};
  Platform platform{
      limits,       counters,         log,     clock,        *reactor,       *reactor,      workers, random,
      userDefaults, deviceProperties, consent, cryptography, propertyLists,  json,          deflate, memory,
      urlSessions,  udpSockets,       bundle,  bundle,       fileExtensions, pluginBundles, powerLog};
  ~Machine() {
    workers.shutDown();
    if (reactor) reactor->stop();
  }
};

void pauseFor(Duration duration) {
  Semaphore never;
  static_cast<void>(never.waitFor(duration));
}

std::shared_ptr<DashboardBackend> makeBackend(Machine& machine, const Options& options) {
  std::shared_ptr<DashboardBackend> backend;
  if (options.withoutProfile) {
    backend =
        DashboardBackend::initWithName(machine.platform, kKYTReportingBackendDashboard,
                                       std::optional<String>(options.server), options.port, std::nullopt);
  } else {
    Dictionary profile{{"ip", options.server}, {"port", int64_t{options.port}}};
    if (options.reliable > 0) profile.set("reliable", options.reliable);
    backend = DashboardBackend::initWithName(machine.platform, kKYTReportingBackendDashboard,
                                             std::optional<Dictionary>(profile), std::nullopt);
  }
  if (!backend) return nullptr;
  backend->setSessionID(options.session);
  backend->setCompType(options.clientType);
  backend->setClientVersion(options.clientVersion);
  backend->setSelfVersion(options.selfVersion);
  backend->setUdid(options.device.c_str());
  return backend;
}

TimeValue timeFrom(const Value* time, const Clock& clock) {
  if (time == nullptr) return clock.timeOfDay();
  // Rounded: 5.004 is a little less than that as a binary number, and is meant as 5.004.
  constexpr int64_t kMicrosecondsInSecond = 1000000;
  constexpr double kMostSeconds = 1e12;
  const int64_t microseconds = std::llround(std::clamp(time->doubleValue(), -kMostSeconds, kMostSeconds) *
                                            static_cast<double>(kMicrosecondsInSecond));
  int64_t seconds = microseconds / kMicrosecondsInSecond;
  if (microseconds % kMicrosecondsInSecond < 0) --seconds;
  return {seconds, static_cast<int32_t>(microseconds - seconds * kMicrosecondsInSecond)};
}

// Null when the line is no event.
Value sendLine(Machine& machine, DashboardBackend& backend, const std::string& text, uint16_t& number) {
  const auto parsed = machine.json.parse(text);
  const Value* value = std::get_if<Value>(&parsed);
  const Dictionary* event = value != nullptr ? value->dictionary() : nullptr;
  const Value* method = event != nullptr ? event->find("method") : nullptr;
  const Value* respCode = event != nullptr ? event->find("respCode") : nullptr;
  if (method == nullptr || respCode == nullptr) return {};
  const Value* given = event->find("event");
  number = static_cast<uint16_t>(given != nullptr ? given->intValue() : number + 1);
  const Value* message = event->find("message");
  const Dictionary* pairs = message != nullptr ? message->dictionary() : nullptr;
  return backend.sendMessage(pairs != nullptr ? *pairs : Dictionary(),
                             timeFrom(event->find("time"), machine.clock),
                             static_cast<uint16_t>(method->intValue()),
                             static_cast<uint16_t>(respCode->intValue()), EventID{number});
}

// The clean-up waits for acknowledgements, and has a last resort of its own.
bool waitForEnd(Machine& machine) {
  const MonotonicTime end = machine.clock.monotonic() + kLongestEnd;
  while (machine.udpSockets.openSockets() != 0) {
    if (machine.clock.monotonic() > end) return false;
    pauseFor(kPoll);
  }
  return true;
}

int feed(const Options& options, std::istream& in) {
  Machine machine;
  if (!machine.reactor) return 2;
  std::shared_ptr<DashboardBackend> backend = makeBackend(machine, options);
  if (!backend) return 2;
  int status = 0;
  uint16_t number = 0;
  for (std::string text; std::getline(in, text);) {
    if (text.empty()) continue;
    const Value line = sendLine(machine, *backend, text, number);
    if (line.isNull()) {
      std::fprintf(stderr, "kytfeed: no event: %s\n", escapedText(text.substr(0, kLongestShown)).c_str());
      status = 1;
      break;
    }
    std::puts(escapedText(line.string()->view()).c_str());
    std::fflush(stdout);
    if (options.intervalMilliseconds > 0) pauseFor(std::chrono::milliseconds(options.intervalMilliseconds));
  }
  backend->cleanup();
  backend.reset();
  return waitForEnd(machine) ? status : 2;
}

}  // namespace
}  // namespace kyt::tools

int main(int argc, char** argv) {
  kyt::tools::Options options;
  CLI::App app("Feeds events to a dashboard server and prints their local log lines", "kytfeed");
  kyt::addCommonOptions(app);
  app.add_option("--server", options.server, "The server's IPv4 address")->required();
  app.add_option("--port", options.port, "Its UDP port")->required();
  app.add_option("--reliable", options.reliable, "Reliable delivery: milliseconds between its ticks");
  app.add_flag("--without-profile", options.withoutProfile, "As a back end without one: reliable, 500 ms");
  app.add_option("--session", options.session, "The session ID, 32 bits");
  app.add_option("--client-type", options.clientType, "The client type, 0 to 23");
  app.add_option("--client-version", options.clientVersion, "The client version, 16 bits");
  app.add_option("--self-version", options.selfVersion, "The reporting side's version");
  app.add_option("--device", options.device, "The device identifier; 40 characters are sent");
  app.add_option("--interval", options.intervalMilliseconds, "Milliseconds between events");
  app.add_option("events", options.file, "A file with one JSON object a line, or - for standard input");
  if (const auto status = kyt::parseCommandLine(app, argc, argv)) return *status;
  if (options.file == "-") return kyt::tools::feed(options, std::cin);
  std::ifstream file(options.file);
  if (!file) {
    std::fprintf(stderr, "kytfeed: can't read %s\n", options.file.c_str());
    return 1;
  }
  return kyt::tools::feed(options, file);
}
