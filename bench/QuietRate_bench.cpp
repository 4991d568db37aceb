// What the daemon's threads cost at a quiet rate: four writers, each a process of its own, send 1,250
// messages of 600 bytes a second; the reactor sees each, the connection's queue reads it. Printed is this
// process's processor time for each message, beside a reference that does the same reads on one thread
// straight from epoll.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/epoll.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <thread>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/Threads.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {
namespace {

constexpr int kClients = 4;
constexpr long kMessageBytes = 600;
std::atomic<long> received{0};
Duration workOfMessage{};

// A pool that keeps its queues to itself.
class LendsNone final : public Executor {
 public:
  explicit LendsNone(WorkerPool& pool) : pool_(pool) {}
  void submit(std::shared_ptr<SerialQueue> queue) override { pool_.submit(std::move(queue)); }

 private:
  WorkerPool& pool_;
};

double processorSeconds() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
         static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

// In a child process: sends until its parent is gone.
[[noreturn]] void sendSteadily(int descriptor, int client, long perSecond) {
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  std::array<char, kMessageBytes> message{};
  timespec next{};
  clock_gettime(CLOCK_MONOTONIC, &next);
  while (perSecond == 0)
    if (write(descriptor, message.data(), message.size()) < 0) _exit(0);
  const long step = 1000000000 / perSecond;
  next.tv_nsec += step * client / kClients;
  for (;;) {
    next.tv_nsec += step;
    while (next.tv_nsec >= 1000000000) {
      next.tv_nsec -= 1000000000;
      ++next.tv_sec;
    }
    clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &next, nullptr);
    if (write(descriptor, message.data(), message.size()) < 0) _exit(0);
  }
}

struct Clients {
  std::vector<Descriptor> sockets;
  std::vector<pid_t> writers;
  explicit Clients(long perSecond) {
    for (int i = 0; i < kClients; ++i) {
      int pair[2];
      if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) abort();
      const pid_t child = fork();
      if (child == 0) {
        close(pair[0]);
        sendSteadily(pair[1], i, perSecond);
      }
      close(pair[1]);
      fcntl(pair[0], F_SETFL, O_NONBLOCK);
      sockets.push_back(ownDescriptor(pair[0]));
      writers.push_back(child);
    }
  }
  ~Clients() {
    for (pid_t writer : writers) {
      kill(writer, SIGKILL);
      waitpid(writer, nullptr, 0);
    }
  }
};

// Reads until there is no more, as a connection does with edge-triggered readiness: a short read says so.
// False when there is more than one turn's worth.
bool drain(int descriptor) {
  std::array<char, 65536> buffer;
  for (size_t bytes = 0;; bytes += buffer.size()) {
    if (bytes >= 256 * kMessageBytes) return false;
    const ssize_t got = read(descriptor, buffer.data(), buffer.size());
    if (got <= 0) return true;
    const long messages = got / kMessageBytes;
    if (workOfMessage > Duration::zero()) {
      const auto end = std::chrono::steady_clock::now() + workOfMessage * messages;
      while (std::chrono::steady_clock::now() < end) {
      }
    }
    received.fetch_add(messages, std::memory_order_relaxed);
    if (static_cast<size_t>(got) < buffer.size()) return true;
  }
}

void measure(const char* name) {
  sleep(1);
  const double before = processorSeconds();
  const long first = received;
  sleep(3);
  const long messages = received - first;
  printf("%-28s %6.2f us of processor time for each of %ld messages a second\n", name,
         (processorSeconds() - before) / static_cast<double>(messages) * 1e6, messages / 3);
  fflush(stdout);
}

void reference(long perSecond) {
  Clients clients(perSecond);
  std::atomic<bool> stop{false};
  std::thread reader([&] {
    const Descriptor epoll = ownDescriptor(epoll_create1(EPOLL_CLOEXEC));
    for (Descriptor& socket : clients.sockets) {
      epoll_event event{};
      event.events = EPOLLIN | EPOLLET;
      event.data.fd = socket.get();
      epoll_ctl(epoll.get(), EPOLL_CTL_ADD, socket.get(), &event);
    }
    std::array<epoll_event, 16> events;
    while (!stop) {
      const int count = epoll_wait(epoll.get(), events.data(), 16, 1000);
      for (int i = 0; i < count; ++i)
        while (!drain(events[static_cast<size_t>(i)].data.fd)) {
        }
    }
  });
  measure("epoll and read, one thread");
  stop = true;
  reader.join();
}

void turn(SerialQueue& queue, int descriptor) {
  if (!drain(descriptor)) queue.async([&queue, descriptor] { turn(queue, descriptor); });
}

void reactorAndQueues(const char* name, long perSecond, bool lends) {
  Clients clients(perSecond);
  WorkerPoolOptions options;
  options.nameThread = beginServiceThread;
  WorkerPool pool(options);
  LendsNone workersOnly(pool);
  auto reactor = EpollReactor::create();
  std::vector<std::shared_ptr<SerialQueue>> queues;
  std::vector<Watch> watches;
  for (Descriptor& socket : clients.sockets) {
    auto queue = SerialQueue::create("connection", lends ? static_cast<Executor&>(pool) : workersOnly);
    queues.push_back(queue);
    watches.push_back(reactor->watch(
        socket.get(), ready::readable | ready::edgeTriggered,
        [queue, fd = socket.get()](unsigned) { queue->async([&queue = *queue, fd] { turn(queue, fd); }); }));
  }
  const uint64_t wakeUps = reactor->wakeUps();
  const uint64_t workerWakeUps = pool.figures().wakeUps;
  const long first = received;
  measure(name);
  const double messages = static_cast<double>(received - first);
  printf("  wake-ups for each message: reactor %.3f, workers %.3f\n",
         static_cast<double>(reactor->wakeUps() - wakeUps) / messages,
         static_cast<double>(pool.figures().wakeUps - workerWakeUps) / messages);
  watches.clear();
  reactor->stop();
  pool.shutDown();
}

}  // namespace
}  // namespace kyt

int main(int argc, char** argv) {
  const long perSecond = argc > 1 ? atol(argv[1]) : 1250;
  if (argc > 2) kyt::workOfMessage = std::chrono::microseconds(atol(argv[2]));
  for (int round = 0; round < 2; ++round) {
    kyt::reference(perSecond);
    kyt::reactorAndQueues("reactor and workers", perSecond, true);
    kyt::reactorAndQueues("… workers only", perSecond, false);
  }
}
