// The service manager's side of the process: what it is told, the service class of the thread, and the process
// transaction that decides about ending when idle. (The socket that it hands over: UnixSocketAcceptor.)
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/ProcessTransaction.h"
#include "platform/base/Clock.h"
#include "platform/base/Mutex.h"
#include "platform/queues/Timer.h"

namespace kyt {

class ServiceManager {
 public:
  // Told over NOTIFY_SOCKET; nothing happens without one. Waits two seconds at most when nobody reads there.
  // `status` is one line for people.
  static void ready(const std::string& status);
  static void stopping();
  static void status(const std::string& status);
  static void alive();  // Watchdog.h
};

// Makes the calling thread, and those it starts, give way to others: the utility class is a nice value of at
// least 5 and the best-effort I/O class at priority 6. False when the system refused one of them, which harms
// nobody.
bool enterUtilityServiceClass();

// Keeps count of whether a transaction is open. While none is and the process was socket-activated,
// `idleElapsed` runs on `queue` after that many seconds without one, counted from the last end() or from the
// start. It answers whether the process will end; when something outstanding keeps it, the wait begins anew.
class LinuxProcessTransaction final : public ProcessTransaction {
 public:
  struct Options {
    bool socketActivated = false;
    double idleExitSeconds = 30;
  };
  LinuxProcessTransaction(Options options, TimerService& timers, std::shared_ptr<SerialQueue> queue,
                          std::function<bool()> idleElapsed);
  ~LinuxProcessTransaction() override;
  void begin() override;
  void end() override;
  [[nodiscard]] bool isOpen() const;

 private:
  struct State;
  static void wait(const std::shared_ptr<State>& state);
  // Shared with the timer's work, which may be on its way when this object ends.
  const std::shared_ptr<State> state_;
};

}  // namespace kyt
