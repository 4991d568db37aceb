// One reporting program of the soak: sessions one after another until its time is over, then a line with its books. A
// "steady" one behaves and must lose nothing; a "wild" one calls everything with everything.
//
//   kyt_soak_client steady|wild SOCKET NONCE SEED SECONDS PACE BOOK
//
// Each event carries NONCE and a number of its own, by which the server knows whether it arrived, and how often. BOOK is
// a file of as many eight-byte entries as there may be events. The first says how many were handed over, the second is
// written by whoever started this, 1 while steady programs are to wait; the one of an event's number says when it was
// handed over (monotonic milliseconds, times four) and what became of that (see Entry). A program that is killed leaves
// its book too.
// PACE: a steady program pauses for up to so many milliseconds between its bursts.
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <future>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "kytreporting/KYTReporting.h"

namespace kyt {
namespace {

using Clock = std::chrono::steady_clock;
constexpr auto kPatience = std::chrono::seconds(60), kLongestHold = std::chrono::seconds(10);

enum class Entry : int64_t { never, handedOver, accepted, refused };

// The file that tells of each event, shared with whoever looks at it.
class EventBook {
 public:
  explicit EventBook(const char* path) {
    const int file = ::open(path, O_RDWR | O_CLOEXEC);
    struct stat status {};
    if (file < 0 || ::fstat(file, &status) != 0) std::abort();
    void* mapped =
        ::mmap(nullptr, static_cast<size_t>(status.st_size), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    ::close(file);
    if (mapped == MAP_FAILED) std::abort();
    entries_ = static_cast<int64_t*>(mapped);
    size_ = static_cast<size_t>(status.st_size) / sizeof(int64_t);
  }
  // The number of an event that is handed over now.
  uint64_t next() {
    if (++number_ >= size_) std::abort();
    write(Entry::handedOver);
    __atomic_store_n(entries_, static_cast<int64_t>(number_ - 1), __ATOMIC_RELAXED);
    return number_;
  }
  [[nodiscard]] bool holds() const { return __atomic_load_n(entries_ + 1, __ATOMIC_RELAXED) == 1; }
  // What became of the one that next() gave last.
  void write(Entry entry) {
    const auto now = std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now().time_since_epoch());
    __atomic_store_n(entries_ + number_, now.count() * 4 + static_cast<int64_t>(entry), __ATOMIC_RELAXED);
  }

 private:
  int64_t* entries_;
  uint64_t number_ = 1, size_;
};

class Books {
 public:
  void add(const KYTReporting::Statistics& statistics) {
    sent_ += statistics.sent;
    lost_ += statistics.lostOnConnectionEnd + statistics.lostInQueue;
    dropped_ += statistics.droppedQueueFull + statistics.droppedClosed + statistics.droppedInvalid +
                statistics.droppedUnsendable + statistics.droppedTooLate;
    if (statistics.connections > 1) reconnected_ += statistics.connections - 1;
  }
  void addLatency(Clock::duration duration) { latencies_.push_back(duration); }
  void addProblem(const std::string& text) {
    if (problems_.size() < 400) problems_ += problems_.empty() ? text : "; " + text;
  }
  uint64_t accepted = 0, sessions = 0;

  void print() {
    std::sort(latencies_.begin(), latencies_.end());
    const auto at = [this](double share) {
      if (latencies_.empty()) return 0.0;
      const auto index = static_cast<size_t>(share * static_cast<double>(latencies_.size() - 1));
      return std::chrono::duration<double, std::milli>(latencies_[index]).count();
    };
    std::printf(
        "{\"accepted\":%llu,\"sessions\":%llu,\"sent\":%llu,\"lost\":%llu,\"dropped\":%llu,\"reconnected\":%llu,"
        "\"latencies\":%zu,\"p50\":%.3f,\"p99\":%.3f,\"worst\":%.3f,\"problems\":\"%s\"}\n",
        number(accepted), number(sessions), number(sent_), number(lost_), number(dropped_),
        number(reconnected_), latencies_.size(), at(0.5), at(0.99), at(1), problems_.c_str());
  }

 private:
  static unsigned long long number(uint64_t value) { return value; }
  uint64_t sent_ = 0, lost_ = 0, dropped_ = 0, reconnected_ = 0;
  std::vector<Clock::duration> latencies_;
  std::string problems_;
};

class Program {
 public:
  Program(std::string socket, std::string nonce, uint64_t seed, uint64_t pace, const char* book)
      : socket_(std::move(socket)), nonce_(std::move(nonce)), random_(seed), pace_(pace), book_(book) {}

  void runSteady(Clock::time_point end) {
    while (Clock::now() < end) steadySession();
    books_.print();
  }
  void runWild(Clock::time_point end) {
    std::vector<std::unique_ptr<KYTReporting>> open;
    while (Clock::now() < end) {
      if (open.size() < 8 && draw(3) == 0) open.push_back(wildSession());
      if (open.empty()) continue;
      const size_t which = draw(open.size());
      if (draw(40) == 0) {
        if (draw(2) == 0) static_cast<void>(open[which]->finish(std::chrono::seconds(draw(3))));
        books_.add(open[which]->statistics());
        open.erase(open.begin() + static_cast<std::ptrdiff_t>(which));
      } else {
        wildCall(*open[which]);
        std::this_thread::sleep_for(std::chrono::milliseconds(draw(50)));
      }
    }
    for (const auto& session : open) books_.add(session->statistics());
    books_.print();
  }

 private:
  uint64_t draw(uint64_t bound) { return std::uniform_int_distribution<uint64_t>(0, bound - 1)(random_); }
  std::string text(size_t most) { return std::string(draw(most), static_cast<char>('a' + draw(26))); }

  Dictionary payload() {
    Dictionary event{{"nonce", nonce_}, {"number", static_cast<int64_t>(book_.next())}};
    for (uint64_t left = draw(12); left > 0; --left) {
      const std::string key = "field" + std::to_string(left);
      if (draw(2) == 0)
        event.set(key, text(40));
      else
        event.set(key, static_cast<int64_t>(draw(1U << 30)));
    }
    return event;
  }

  std::unique_ptr<KYTReporting> session(int clientType, const std::string& name, bool batch, uint64_t token) {
    KYTReporting::Options options;
    options.socketPath = socket_;
    options.sessionInfo =
        Dictionary{{kKYTReportingSessionInfoSessionID, static_cast<int64_t>(draw(1U << 31))},
                   {kKYTReportingSessionInfoClientType, clientType},
                   {kKYTReportingSessionInfoBatchEvent, batch},
                   {kKYTReportingSessionInfoRequireUserInfo, !name.empty()}};
    if (token != 0)
      options.sessionInfo.set(
          kKYTReportingSessionInfoHierarchyToken,
          Dictionary{{kKYTReportingHierarchyTokenLevel, static_cast<int64_t>(draw(6))},
                     {kKYTReportingHierarchyTokenTokenID, "soak-" + std::to_string(token)}});
    if (!name.empty())
      options.userInfo =
          Dictionary{{kKYTReportingUserInfoClientName, name}, {kKYTReportingUserInfoServiceName, "soak"}};
    if (token != 0 && draw(4) == 0) options.aggregationBlock = [](const AggregatedMessage&) {};
    return KYTReporting::open(std::move(options));
  }

  void steadySession() {
    const auto session = this->session(12, draw(2) == 0 ? "steady" : "steadytls", draw(4) != 0, 0);
    ++books_.sessions;
    const auto configured = std::make_shared<std::promise<bool>>();
    session->startConfiguration([configured](const auto& states, const auto& error) {
      configured->set_value(!error && states && !states->empty());
    });
    auto answer = configured->get_future();
    if (answer.wait_for(kPatience) != std::future_status::ready)
      books_.addProblem("no answer to a configuration");
    for (uint64_t left = 1 + draw(6); left > 0; --left) {
      for (uint64_t burst = 1 + draw(100); burst > 0; --burst)
        report(*session, 1 + draw(5), 1, draw(20) == 0 ? 1 : 0);
      ask(*session);
      std::this_thread::sleep_for(std::chrono::milliseconds(draw(pace_ + 1)));
      for (const auto end = Clock::now() + kLongestHold; book_.holds() && Clock::now() < end;)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    if (!session->finish(kPatience)) books_.addProblem("not finished in time");
    books_.add(session->statistics());
  }
  void report(KYTReporting& session, uint64_t category, uint64_t type, uint64_t flag) {
    const bool taken = session.sendMessage(static_cast<uint32_t>(category), static_cast<uint32_t>(type),
                                           payload(), static_cast<uint32_t>(flag));
    book_.write(taken ? Entry::accepted : Entry::refused);
    if (taken) ++books_.accepted;
  }
  // A round trip that no server has a part in.
  void ask(KYTReporting& session) {
    const auto asked = std::make_shared<std::promise<bool>>();
    const auto begin = Clock::now();
    session.fetchDisplayURL([asked](const std::string&, const auto& error) { asked->set_value(!error); });
    auto answer = asked->get_future();
    if (answer.wait_for(kPatience) != std::future_status::ready)
      return books_.addProblem("no answer to a question");
    if (answer.get()) books_.addLatency(Clock::now() - begin);
  }

  std::unique_ptr<KYTReporting> wildSession() {
    static constexpr int kTypes[] = {5, 6, 7, 8, 9, 10, 11, 13, 14, 16, 17, 20, 23, 0, 3, 99};
    ++books_.sessions;
    auto made = session(kTypes[draw(std::size(kTypes))], draw(3) == 0 ? std::string() : "wild" + text(3),
                        draw(2) == 0, draw(2) == 0 ? 0 : 1 + draw(5));
    if (draw(5) != 0) made->startConfiguration();
    return made;
  }
  void wildCall(KYTReporting& session) {
    switch (draw(16)) {
      case 0:
        return session.flush();
      case 1:
        return session.fetchStates(
            Dictionary{{kKYTReportingUserInfoClientName, "wild" + text(3)}, {text(5), text(100)}});
      case 2:
        return session.updateSharedData(Dictionary{{text(8), text(draw(20) == 0 ? 100000 : 100)}});
      case 3:
        return session.setDigestKey(Data("key"), static_cast<int32_t>(draw(3)));
      case 4:
        return session.uploadLogData(Array{text(1000), 1, text(10)});
      case 5:
        return session.uploadFile(draw(2) == 0 ? "/etc/hostname" : "/etc");
      case 6:
        return session.startConfiguration();
      case 7:
        return session.sendMessage(1, 1, payload(), static_cast<uint32_t>(draw(4)),
                                   [](const auto&, const auto&) {});
      case 8: {
        KYTReporting::Options options;
        options.socketPath = socket_;
        options.sessionInfo =
            Dictionary{{kKYTReportingSessionInfoSessionID, 1},
                       {kKYTReportingSessionInfoClientType, static_cast<int64_t>(draw(24))}};
        return KYTReporting::sendSingleMessage(std::move(options), 1, 1, payload(), nullptr);
      }
      case 9:
        static_cast<void>(session.sendMessage(
            1, 1, Dictionary{{"long", std::string(draw(10) == 0 ? 1500000 : 50000, 'x')}, {"\xff", "\xfe"}}));
        return;
      default:
        for (uint64_t burst = draw(50); burst > 0; --burst) report(session, draw(7), draw(4), draw(5));
    }
  }

  std::string socket_, nonce_;
  std::mt19937_64 random_;
  uint64_t pace_;
  EventBook book_;
  Books books_;
};

}  // namespace
}  // namespace kyt

int main(int argc, char** argv) {
  if (argc != 8) {
    std::fprintf(stderr, "usage: kyt_soak_client steady|wild SOCKET NONCE SEED SECONDS PACE BOOK\n");
    return 2;
  }
  const std::string kind = argv[1];
  const auto end = kyt::Clock::now() + std::chrono::seconds(std::strtoul(argv[5], nullptr, 10));
  kyt::Program program(argv[2], argv[3], std::strtoull(argv[4], nullptr, 10),
                       std::strtoull(argv[6], nullptr, 10), argv[7]);
  if (kind == "steady")
    program.runSteady(end);
  else
    program.runWild(end);
  return 0;
}
