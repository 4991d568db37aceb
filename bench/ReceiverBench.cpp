// The receiver's processor time for a post beside a program's that only reads, hashes and publishes it (ReceiverFloor.cpp),
// with the same server of the log, in the same run, both as fast as they take posts; and that of one, two and four receivers
// of which each has devices of its own that post at the same rate.
//
//   kyt_bench_receiver PROGRAMS [POSTS]
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "http/PostDigest.h"
#include "tests/receiver/NatsServer.h"
#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"

namespace kyt::receiver {
namespace {

constexpr size_t kBodyBytes = 7500;   // of a batch of 100 events, compressed
constexpr unsigned kDevices = 32;     // … that post one after another
constexpr unsigned kDevicesEach = 8;  // of each receiver, that post 250 times a second
constexpr std::chrono::microseconds kPeriod(4000);

// User and system time of the process, in microseconds.
double processorTime(int pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text;
  std::getline(in, text);
  text.erase(0, text.rfind(')') + 2);
  std::istringstream fields(text);
  std::string skipped;
  for (int i = 0; i < 11; ++i) fields >> skipped;
  double user = 0, system = 0;
  fields >> user >> system;
  return (user + system) * 1e6 / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

struct Outcome {
  double seconds = 0;
  std::vector<double> milliseconds;  // sorted
  uint64_t failed = 0;
};

// So many posts, by devices that wait for each answer, to these ports in turn; a device posts once in each period.
Outcome post(const std::vector<uint16_t>& ports, uint64_t posts, unsigned count,
             std::chrono::microseconds period) {
  std::atomic<uint64_t> next{0}, failed{0};
  std::vector<std::vector<double>> times(count);
  std::vector<std::thread> devices;
  const auto begin = std::chrono::steady_clock::now();
  for (unsigned device = 0; device < count; ++device)
    devices.emplace_back([&, device] {
      HttpConnection connection(ports[device % ports.size()]);
      std::mt19937_64 random(std::random_device{}());
      std::string body = "\x1f\x8b\x08" + std::string(kBodyBytes, 'x');
      auto due = begin + period * device / count;
      while (next++ < posts) {
        std::this_thread::sleep_until(due);
        due += period;
        for (size_t i = 3; i + 8 <= body.size(); i += 8) {
          const uint64_t noise = random();
          body.replace(i, 8, reinterpret_cast<const char*>(&noise), 8);
        }
        const std::string digest = http::digestText("key", body);
        const auto sent = std::chrono::steady_clock::now();
        const HttpReply reply = connection.post(
            "/v1/events", body,
            {"Content-Encoding: gzip", "X-KYT-Sender: QPW", "X-KYT-Client-Name: videocall",
             "X-KYT-Service-Name: calls", "X-KYT-Client-Version: 3", "X-KYT-DIGEST: " + digest});
        times[device].push_back(
            std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - sent).count());
        if (reply.status != 200) ++failed;
      }
    });
  for (std::thread& device : devices) device.join();
  Outcome outcome;
  outcome.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
  outcome.failed = failed;
  for (const auto& some : times)
    outcome.milliseconds.insert(outcome.milliseconds.end(), some.begin(), some.end());
  std::sort(outcome.milliseconds.begin(), outcome.milliseconds.end());
  return outcome;
}

void tell(const char* what, const Outcome& outcome, double processor, uint64_t posts) {
  const auto at = [&](double part) {
    return outcome
        .milliseconds[static_cast<size_t>(part * static_cast<double>(outcome.milliseconds.size() - 1))];
  };
  std::printf(
      "%-28s %8.0f posts/s  %6.1f us of processor a post  median %5.2f ms  99th %6.2f ms  failed %llu\n",
      what, static_cast<double>(posts) / outcome.seconds, processor / static_cast<double>(posts), at(0.5),
      at(0.99), static_cast<unsigned long long>(outcome.failed));
  std::fflush(stdout);
}

int run(const std::string& programs, uint64_t posts) {
  NatsServers servers;
  servers.start();
  StreamView view(servers.url(0));
  std::vector<std::unique_ptr<ReceiverProcess>> receivers;
  for (int i = 0; i < 4; ++i) {
    ReceiverProcess::Options options;
    options.servers = servers.urlsAsToml();
    options.program = programs + "/kytreceiver";
    options.path = "digest = \"required\"\ndigest_keys = { \"QPW/videocall\" = [\"6b6579\"] }\n";
    receivers.push_back(std::make_unique<ReceiverProcess>(options));
    if (i == 0 && !eventually([&] {
          auto made = tools::ChildProcess::start(
              options.program, {"--config", receivers[0]->configFile(), "--make-streams"}, {});
          return made && made->wait(kTestDeadline) == 0;
        }))
      return 1;
    if (!receivers.back()->becomesReady()) return 1;
  }
  int in[2], out[2];
  if (::pipe2(in, O_CLOEXEC) != 0 || ::pipe2(out, O_CLOEXEC) != 0) return 1;
  const std::string floor = programs + "/kyt_bench_receiver_floor", url = servers.url(0);
  const pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(in[0], STDIN_FILENO);
    ::dup2(out[1], STDOUT_FILENO);
    ::execl(floor.c_str(), floor.c_str(), url.c_str(), nullptr);
    ::_exit(127);
  }
  char text[16] = "";
  if (::read(out[0], text, sizeof text - 1) <= 0) return 1;
  const auto floorPort = static_cast<uint16_t>(std::atoi(text));
  for (int round = 0; round < 3; ++round) {
    double before = processorTime(pid);
    const Outcome bare = post({floorPort}, posts, kDevices, {});
    tell("floor", bare, processorTime(pid) - before, posts);
    before = processorTime(pid);
    const Outcome slow = post({floorPort}, posts, kDevicesEach, kPeriod);
    tell("floor at 2000 posts/s", slow, processorTime(pid) - before, posts);
    before = processorTime(receivers[0]->pid());
    const Outcome one = post({receivers[0]->port()}, posts, kDevices, {});
    tell("1 receiver", one, processorTime(receivers[0]->pid()) - before, posts);
    for (const unsigned count : {1u, 2u, 4u}) {
      std::vector<uint16_t> ports;
      before = 0;
      double after = 0;
      for (size_t i = 0; i < count; ++i) {
        ports.push_back(receivers[i]->port());
        before += processorTime(receivers[i]->pid());
      }
      const Outcome outcome = post(ports, posts, kDevicesEach * count, kPeriod);
      for (size_t i = 0; i < count; ++i) after += processorTime(receivers[i]->pid());
      tell((std::to_string(count) + " at 2000 posts/s each").c_str(), outcome, after - before, posts);
    }
    static_cast<void>(view.purge());
  }
  ::close(in[1]);
  ::waitpid(pid, nullptr, 0);
  return 0;
}

}  // namespace
}  // namespace kyt::receiver

int main(int argc, char** argv) {
  if (argc < 2) return std::fprintf(stderr, "usage: kyt_bench_receiver PROGRAMS [POSTS]\n"), 2;
  return kyt::receiver::run(argv[1], argc > 2 ? std::strtoull(argv[2], nullptr, 10) : 20000);
}
