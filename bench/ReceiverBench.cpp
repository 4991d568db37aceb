// The receiver's processor time for a post beside a program's that only reads, hashes and publishes it (ReceiverFloor.cpp),
// with the same server of the log, in the same run, both as fast as they take posts; and that of one, two and four receivers
// of which each has devices of its own that post at the same rate.
//
// Ends with 0 where both are within bounds that leave room for a machine that does other things too (run()), so
// `./kyt fleet --check` runs it.
//
//   kyt_bench_receiver PROGRAMS [POSTS [ROUNDS]]
#include <fcntl.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "http/PostDigest.h"
#include "platform/linux/base/Descriptors.h"
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
  clockid_t clock{};
  timespec time{};
  if (::clock_getcpuclockid(pid, &clock) != 0 || ::clock_gettime(clock, &time) != 0) return 0;
  return static_cast<double>(time.tv_sec) * 1e6 + static_cast<double>(time.tv_nsec) * 1e-3;
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

// The server of the log, four receivers, and the floor.
class Stand {
 public:
  explicit Stand(std::string programs) : programs_(std::move(programs)) {}
  ~Stand() {
    input_ = Descriptor();  // upon which the floor ends
    if (floor_ > 0) ::waitpid(floor_, nullptr, 0);
  }
  Stand(const Stand&) = delete;
  Stand& operator=(const Stand&) = delete;

  // Whether all of it takes posts.
  [[nodiscard]] bool start() {
    servers_.start();
    view_.emplace(servers_.url(0));
    for (int i = 0; i < 4; ++i) {
      ReceiverProcess::Options options;
      options.servers = servers_.urlsAsToml();
      options.program = programs_ + "/kytreceiver";
      options.path = "digest = \"required\"\ndigest_keys = { \"QPW/videocall\" = [\"6b6579\"] }\n";
      receivers_.push_back(std::make_unique<ReceiverProcess>(options));
      if (i == 0 && !makeStreams()) return false;
      if (!receivers_.back()->becomesReady()) return false;
    }
    return startFloor();
  }
  void empty() { static_cast<void>(view_->purge()); }
  [[nodiscard]] uint16_t floorPort() const { return floorPort_; }
  [[nodiscard]] double floorTime() const { return processorTime(floor_); }
  // Of the first so many.
  [[nodiscard]] std::vector<uint16_t> ports(unsigned count) const {
    std::vector<uint16_t> ports;
    for (size_t i = 0; i < count; ++i) ports.push_back(receivers_[i]->port());
    return ports;
  }
  [[nodiscard]] double time(unsigned count) const {
    double sum = 0;
    for (size_t i = 0; i < count; ++i) sum += processorTime(receivers_[i]->pid());
    return sum;
  }

 private:
  [[nodiscard]] bool makeStreams() const {
    return eventually([&] {
      auto made = tools::ChildProcess::start(programs_ + "/kytreceiver",
                                             {"--config", receivers_[0]->configFile(), "--make-streams"}, {});
      return made && made->wait(kTestDeadline) == 0;
    });
  }
  [[nodiscard]] bool startFloor() {
    int in[2], out[2];
    if (::pipe2(in, O_CLOEXEC) != 0 || ::pipe2(out, O_CLOEXEC) != 0) return false;
    const Descriptor floorIn = ownDescriptor(in[0]), floorOut = ownDescriptor(out[1]),
                     output = ownDescriptor(out[0]);
    input_ = ownDescriptor(in[1]);
    const std::string program = programs_ + "/kyt_bench_receiver_floor", url = servers_.url(0);
    floor_ = ::fork();
    if (floor_ == 0) {
      ::dup2(in[0], STDIN_FILENO);
      ::dup2(out[1], STDOUT_FILENO);
      ::execl(program.c_str(), program.c_str(), url.c_str(), nullptr);
      ::_exit(127);
    }
    char text[16] = "";
    if (floor_ < 0 || ::read(output.get(), text, sizeof text - 1) <= 0) return false;
    floorPort_ = static_cast<uint16_t>(std::atoi(text));
    return true;
  }

  const std::string programs_;
  NatsServers servers_;
  std::optional<StreamView> view_;
  std::vector<std::unique_ptr<ReceiverProcess>> receivers_;
  Descriptor input_;  // of the floor
  pid_t floor_ = -1;
  uint16_t floorPort_ = 0;
};

// What a round found of processor time: that of a receiver by the floor's, and that of two and of four receivers by one's.
struct Ratios {
  double busy = 0, quiet = 0, two = 0, four = 0;
  uint64_t failed = 0;
};

Ratios round(Stand& stand, uint64_t posts) {
  Ratios ratios;
  // One after another, so that what else the machine does is much the same for each.
  const auto row = [&](const std::string& what, const auto& time, const auto& work) {
    const double before = time();
    const Outcome outcome = work();
    const double used = time() - before;
    tell(what.c_str(), outcome, used, posts);
    ratios.failed += outcome.failed;
    return used;
  };
  const auto floorTime = [&] { return stand.floorTime(); };
  const std::vector<uint16_t> floor = {stand.floorPort()};
  const double bare = row("floor", floorTime, [&] { return post(floor, posts, kDevices, {}); });
  const double busy = row(
      "1 receiver", [&] { return stand.time(1); }, [&] { return post(stand.ports(1), posts, kDevices, {}); });
  const double slow =
      row("floor at 2000 posts/s", floorTime, [&] { return post(floor, posts, kDevicesEach, kPeriod); });
  const auto each = [&](unsigned count) {
    return row(
        std::to_string(count) + " at 2000 posts/s each", [&] { return stand.time(count); },
        [&] { return post(stand.ports(count), posts, kDevicesEach * count, kPeriod); });
  };
  const double one = each(1);
  ratios.two = each(2) / one;
  ratios.four = each(4) / one;
  ratios.busy = busy / bare;
  ratios.quiet = one / slow;
  stand.empty();
  return ratios;
}

// The goals are 1.5 and 1.15; medians of a few rounds on a machine with other work vary by a quarter, and a check must not fail for that.
constexpr double kMostOfTheFloor = 1.9;
constexpr double kMostOfOne = 1.4;

// Whether the median of the rounds is within the bound.
bool holds(const char* what, std::vector<double> ratios, double most) {
  std::sort(ratios.begin(), ratios.end());
  const double median = ratios[ratios.size() / 2];
  std::printf("%-44s %.2f (%.2f to %.2f), at most %.2f%s\n", what, median, ratios.front(), ratios.back(),
              most, median <= most ? "" : ": FAILED");
  return median <= most;
}

// 0: each median is within its bound, and each post was answered with 200.
int run(const std::string& programs, uint64_t posts, int rounds) {
  Stand stand(programs);
  if (!stand.start()) return std::fprintf(stderr, "the servers did not start\n"), 1;
  std::vector<double> busy, quiet, two, four;
  uint64_t failed = 0;
  for (int i = 0; i < rounds; ++i) {
    const Ratios ratios = round(stand, posts);
    busy.push_back(ratios.busy);
    quiet.push_back(ratios.quiet);
    two.push_back(ratios.two);
    four.push_back(ratios.four);
    failed += ratios.failed;
  }
  bool isGood = holds("a receiver by the floor", busy, kMostOfTheFloor);
  isGood &= holds("a receiver by the floor, 2000 posts/s", quiet, kMostOfTheFloor);
  isGood &= holds("two receivers by one, 2000 posts/s each", two, kMostOfOne);
  isGood &= holds("four receivers by one, 2000 posts/s each", four, kMostOfOne);
  if (failed > 0) std::printf("%llu posts were not taken: FAILED\n", static_cast<unsigned long long>(failed));
  return isGood && failed == 0 ? 0 : 1;
}

}  // namespace
}  // namespace kyt::receiver

int main(int argc, char** argv) {
  if (argc < 2) return std::fprintf(stderr, "usage: kyt_bench_receiver PROGRAMS [POSTS [ROUNDS]]\n"), 2;
  const int rounds = argc > 3 ? std::atoi(argv[3]) : 3;
  if (rounds < 1) return std::fprintf(stderr, "ROUNDS must be 1 or more\n"), 2;
  return kyt::receiver::run(argv[1], argc > 2 ? std::strtoull(argv[2], nullptr, 10) : 20000, rounds);
}
