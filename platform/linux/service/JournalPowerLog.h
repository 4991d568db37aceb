// Power-log events as structured journal entries: KYT_AGENT, KYT_EVENT, and KYT_DICTIONARY as JSON. Without a
// journal there is nobody to record them: then nothing happens, counted. Nobody waits for a journal that is slow or
// stopped: entries wait in a bounded queue (LineWriter.h), and what finds no room there is dropped and counted.
#pragma once

#include <memory>
#include <string>

#include "platform/PowerLog.h"
#include "platform/base/Limits.h"
#include "platform/base/Mutex.h"
#include "platform/linux/base/LineWriter.h"

namespace kyt {

class Counters;
class JournalSocket;

class JournalPowerLog final : public PowerLog {
 public:
  explicit JournalPowerLog(Counters& counters, size_t maxQueuedBytes = Limits::maxQueuedPowerLogBytes)
      : counters_(counters), maxQueuedBytes_(maxQueuedBytes) {}
  ~JournalPowerLog() override;  // waits for what is queued, a second at most
  // May make a thread, for which the process must be ready.
  void registeredEvent(uint32_t agent, std::string_view event, const Dictionary& dictionary) override;

 private:
  [[nodiscard]] bool open() REQUIRES(mutex_);
  [[nodiscard]] bool tryAgain(JournalSocket& socket, const std::string& entry, bool lastTime);

  Counters& counters_;
  const size_t maxQueuedBytes_;
  Mutex mutex_;
  // From the first event for which there was a journal.
  std::unique_ptr<LineWriter> entries_ GUARDED_BY(mutex_);
};

}  // namespace kyt
