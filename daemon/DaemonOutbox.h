// The outbox as the daemon has it, where the settings want one: with threads of its own, its file, and the URL sessions that
// keep what fails. Made by DaemonPlatform.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "outbox/Outbox.h"
#include "outbox/OutboxURLSession.h"
#include "platform/linux/base/FileWatch.h"
#include "platform/linux/outbox/SQLitePostStore.h"
#include "platform/queues/WorkerPool.h"

namespace kyt {

class DaemonOutbox {
 public:
  struct Ports {
    const OutboxSettings& settings;
    std::string folder;  // is there
    Clock& clock;
    TimerService& timers;
    RandomSource& random;
    DiagnosticsConsent& consent;
    Counters& counters;
    Log& log;
    Books& books;
    Departures& departures;
    URLSessionFactory& network;
    Reactor& reactor;
    std::string consentFolder, consentFile;  // where the owner's decision stands
  };
  explicit DaemonOutbox(Ports ports);
  ~DaemonOutbox();
  DaemonOutbox(const DaemonOutbox&) = delete;
  DaemonOutbox& operator=(const DaemonOutbox&) = delete;

  [[nodiscard]] URLSessionFactory& sessions() { return sessions_; }
  [[nodiscard]] Outbox& outbox() { return *outbox_; }
  // For administrators, by the description of their interface: a line for each server.
  [[nodiscard]] std::vector<Dictionary> view() const;
  // After the URL sessions have ended: keeps what is left, and ends the threads. False when the disk takes longer: then the
  // process must end without destroying this.
  [[nodiscard]] bool shutDownWithin(Duration patience);

 private:
  Clock& clock_;
  WorkerPool workers_;
  SQLitePostStore store_;
  const std::shared_ptr<Outbox> outbox_;
  OutboxURLSessionFactory sessions_;
  const FileWatch consentWatch_;
};

}  // namespace kyt
