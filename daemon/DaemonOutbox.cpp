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
    : workers_(workersOfOutbox()),
      store_(std::move(ports.folder)),
      outbox_(
          Outbox::create({ports.clock, ports.timers, ports.random, workers_, ports.consent, ports.counters,
                          ports.log, ports.books, ports.departures, ports.network, store_},
                         ports.settings)),
      sessions_(ports.network, outbox_, workers_) {}

DaemonOutbox::~DaemonOutbox() = default;

bool DaemonOutbox::shutDownWithin(Duration patience) {
  const bool finished = outbox_->finishWithin(patience);
  return workers_.shutDownWithin(finished ? patience : Duration(0)) && finished;
}

}  // namespace kyt
