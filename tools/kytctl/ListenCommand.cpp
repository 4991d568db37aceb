// In the daemon's place, for tests of programs: prints what they tell it.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <iterator>
#include <utility>

#include "kytreporting/FakeDaemon.h"
#include "platform/base/Hex.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/cli/CommandLine.h"
#include "platform/objects/Keys.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

namespace {

// With what JSON has no form for as a number or a text.
Value inJSON(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::date:
      return value.date()->secondsSince1970;
    case Value::Kind::data: {
      std::string digits;
      appendHex(value.data()->bytes(), digits);
      return digits;
    }
    case Value::Kind::array: {
      Array out;
      for (const Value& entry : *value.array()) out.append(inJSON(entry));
      return out;
    }
    case Value::Kind::dictionary: {
      Dictionary out;
      for (const auto& [key, entry] : *value.dictionary()) out.set(key, inJSON(entry));
      return out;
    }
    default:
      return value;
  }
}

void print(const Dictionary& line) {
  std::printf("%s\n", escapedJSON(description(inJSON(line))).c_str());
  std::fflush(stdout);
}

constexpr const char* kBackEnds[] = {kKYTReportingBackendHTTPPost,     kKYTReportingBackendHTTPPost2,
                                     kKYTReportingBackendQRS,          kKYTReportingBackendDashboard,
                                     kKYTReportingBackendUploadServer, kKYTReportingBackendQDX,
                                     kKYTReportingBackendAmpyx};

// Says so, where one of the names is no back end's.
bool areBackEnds(const std::vector<std::string>& names) {
  const auto wrong = std::find_if(names.begin(), names.end(), [](const std::string& name) {
    return std::find(std::begin(kBackEnds), std::end(kBackEnds), name) == std::end(kBackEnds);
  });
  if (wrong == names.end()) return true;
  std::string known;
  for (const char* name : kBackEnds) known += (known.empty() ? "" : ", ") + std::string(name);
  failed("--live: there is no back end \"" + escapedText(*wrong) + "\"; there are " + known);
  return false;
}

std::vector<std::string> namesIn(const std::string& list) {
  std::vector<std::string> names;
  for (size_t begin = 0; begin <= list.size();) {
    const size_t end = std::min(list.find(',', begin), list.size());
    if (end > begin) names.push_back(list.substr(begin, end - begin));
    begin = end + 1;
  }
  return names;
}

}  // namespace

int listenCommand(const ListenOptions& given) {
  std::vector<std::string> live = namesIn(given.live);
  if (!areBackEnds(live)) return kWrongUsage;
  // The daemon's threads inherit the mask: the signals come to this one.
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);

  testing::FakeDaemon::Options options;
  options.socketPath = given.socket;
  options.live = std::move(live);
  options.storebag = !given.noStorebag;
  options.refuse = given.refuse;
  options.dieAfter = given.dieAfter;
  options.onEvent = [left = given.dieAfter](const testing::Event& event) mutable {
    print(event.dictionary());
    if (event.kind == testing::Kind::message && left > 0 && --left == 0) ::_exit(0);
  };
  testing::FakeDaemon daemon(std::move(options));
  if (const auto problem = daemon.start()) return failed(*problem);
  print(Dictionary{{"event", "listening"}, {"socket", given.socket}});
  int signal = 0;
  sigwait(&set, &signal);
  daemon.stop();
  return 0;
}

}  // namespace kyt::tools
