#include "daemon/DaemonOutbox.h"

#include <utility>

#include "platform/linux/base/Threads.h"
#include "platform/linux/service/Process.h"

namespace kyt {
namespace {

// One for the disk, one for completions of posts that were kept.
WorkerPoolOptions workersOfOutbox() {
  WorkerPoolOptions options;
  options.runnable = 2;
  options.maxWorkers = 2;
  options.mostOfOneOwner = 1;
  options.name = "kyt-outbox";
  options.nameThread = beginServiceThread;
  options.whenQuiet = giveFreeMemoryBack;
  return options;
}

}  // namespace

DaemonOutbox::DaemonOutbox(Ports ports)
    : clock_(ports.clock),
      workers_(workersOfOutbox()),
      store_(std::move(ports.folder)),
      outbox_(
          Outbox::create({ports.clock, ports.timers, ports.random, workers_, ports.consent, ports.counters,
                          ports.log, ports.books, ports.departures, ports.network, store_},
                         ports.settings)),
      sessions_(ports.network, outbox_, workers_),
      consentWatch_(ports.reactor, ports.consentFolder, ports.consentFile,
                    [this] { outbox_->consentMayHaveChanged(); }) {}

DaemonOutbox::~DaemonOutbox() = default;

std::vector<Dictionary> DaemonOutbox::view() const {
  using std::chrono::duration_cast;
  using std::chrono::seconds;
  const int64_t now = clock_.timeOfDay().seconds;
  std::vector<Dictionary> views;
  for (const Outbox::Server& server : outbox_->list()) {
    Array users;
    for (const auto& [user, share] : server.users)
      users.append(Dictionary{{"user", user}, {"posts", share.posts}, {"bytes", share.bytes}});
    const int64_t wait = duration_cast<seconds>(server.untilNextTry + std::chrono::milliseconds(999)).count();
    views.push_back(Dictionary{{"server", server.server},
                               {"posts", server.posts},
                               {"bytes", server.bytes},
                               {"inFlight", server.inFlight},
                               {"failures", uint64_t{server.failures}},
                               {"failingAlone", server.failingAlone},
                               {"lastStatus", static_cast<int64_t>(server.lastStatus)},
                               {"oldest", now - duration_cast<seconds>(server.oldest).count()},
                               {"nextTry", wait > 0 ? now + wait : int64_t{0}},
                               {"users", std::move(users)}});
  }
  return views;
}

bool DaemonOutbox::shutDownWithin(Duration patience) {
  const bool finished = outbox_->finishWithin(patience);
  return workers_.shutDownWithin(finished ? patience : Duration(0)) && finished;
}

}  // namespace kyt
