// The real log sinks: the journal and standard error. Both escape what may hold anything
// (TextEscape.h), so one call is one line. Any thread; a line that cannot be written is lost, since
// there is nowhere to say so.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/Settings.h"
#include "platform/linux/base/LineWriter.h"
#include "platform/queues/Log.h"

namespace kyt {

class JournalSocket;

// A line each, in one write: "<7>" in front for debug, "<6>" for default, "<3>" for error.
class StderrSink final : public LogSink {
 public:
  explicit StderrSink(int fd = 2) : fd_(fd) {}
  void write(LogLevel level, std::string_view line) override;

 private:
  const int fd_;
};

// The same for a daemon, which must not wait for whoever reads its log: lines that find no room wait in a queue
// (LineWriter.h), and what finds none there is counted as Reason::logLineDropped.
class PatientStderrSink final : public LogSink {
 public:
  explicit PatientStderrSink(Counters& counters, int fd = 2,
                             size_t maxQueuedBytes = Limits::maxQueuedLogBytes);
  void write(LogLevel level, std::string_view line) override;
  void allowThreads() override { lines_.allowThread(); }

 private:
  LineWriter lines_;
};

// Entries with MESSAGE, PRIORITY (7, 6, 3), SYSLOG_IDENTIFIER and KYT_OPERATION (what stands before the first
// colon). Nobody waits for a journal that is slow or stopped: entries wait in a queue as above. What the journal does not
// take, since it is gone, goes to standard error.
class JournalSink final : public LogSink {
 public:
  // None where the journal's socket cannot be connected to; why is written to standard error.
  [[nodiscard]] static std::unique_ptr<JournalSink> open(Counters& counters,
                                                         std::string identifier = "kytreportingd",
                                                         size_t maxQueuedBytes = Limits::maxQueuedLogBytes);
  void write(LogLevel level, std::string_view line) override;
  void allowThreads() override;
  // Whether the journal's socket is there.
  [[nodiscard]] static bool isAvailable();

 private:
  JournalSink(std::shared_ptr<JournalSocket> socket, Counters& counters, std::string identifier,
              size_t maxQueuedBytes);
  // Whether there is a journal to try again with; otherwise the entry has gone to standard error.
  [[nodiscard]] bool connectAgain(const std::string& entry, bool lastTime);

  const std::shared_ptr<JournalSocket> socket_;
  const std::string identifier_;
  PatientStderrSink fallback_;
  LineWriter entries_;
};

// The journal when its socket is there and standard error was not asked for.
[[nodiscard]] std::unique_ptr<LogSink> makeLogSink(LogTarget target, Counters& counters,
                                                   const std::string& identifier = "kytreportingd");

}  // namespace kyt
