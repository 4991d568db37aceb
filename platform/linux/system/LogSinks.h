// The real log sinks: the journal and standard error. Both escape what may hold anything
// (platform/TextEscape.h), so one call is one line. Any thread; a line that cannot be written is lost, since
// there is nowhere to say so.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/Counters.h"
#include "platform/Limits.h"
#include "platform/Log.h"
#include "platform/Settings.h"
#include "platform/linux/base/LineWriter.h"

struct iovec;

namespace kyt {

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
// colon). What the journal does not take goes to standard error.
class JournalSink final : public LogSink {
 public:
  // None where libsystemd is missing; why is written to standard error.
  [[nodiscard]] static std::unique_ptr<JournalSink> open(Counters& counters,
                                                         std::string identifier = "kytreportingd");
  void write(LogLevel level, std::string_view line) override;
  void allowThreads() override { fallback_.allowThreads(); }
  // Whether the journal's socket is there.
  [[nodiscard]] static bool isAvailable();

 private:
  using Send = int(const iovec*, int);
  JournalSink(Send* send, Counters& counters, std::string identifier)
      : send_(send), identifier_(std::move(identifier)), fallback_(counters) {}
  Send* const send_;  // sd_journal_sendv
  const std::string identifier_;
  PatientStderrSink fallback_;
};

// The journal when its socket is there and standard error was not asked for.
[[nodiscard]] std::unique_ptr<LogSink> makeLogSink(LogTarget target, Counters& counters);

}  // namespace kyt
