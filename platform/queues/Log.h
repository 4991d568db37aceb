// The structured log. It has three levels. Every line begins with the operation that writes it. Texts are printf
// formats, which the compiler checks. A line below the level in force costs one relaxed load.
//
// Any thread may call a `Log`; it never fails and never throws. A text from outside (a client's name, a server's reply)
// may hold anything, at any length: the sinks escape control characters and invalid UTF-8, and cut a line at
// Limits::maxLogLineBytes and say so. The composition root owns the log; everyone else holds a reference.
#pragma once

#include <atomic>
#include <cstdarg>
#include <string>
#include <string_view>

#include "platform/base/LogLevel.h"
#include "platform/objects/Value.h"

namespace kyt {

class LineLimits;

// Where lines go: journald, standard error, or a test's memory. Called from any thread, concurrently.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual void write(LogLevel level, std::string_view line) = 0;
  // Called once, when the process is confined; before that a sink starts no thread.
  virtual void allowThreads() {}
};

class Log {
 public:
  explicit Log(LogSink& sink, LogLevel level = LogLevel::normal)
      : sink_(&sink), level_(static_cast<int>(level)) {}
  Log(const Log&) = delete;
  Log& operator=(const Log&) = delete;

  void setLevel(LogLevel level) { level_.store(static_cast<int>(level), std::memory_order_relaxed); }
  // Only before other threads exist.
  void setSink(LogSink& sink) { sink_ = &sink; }
  void allowThreads() { sink_->allowThreads(); }
  // The log asks these limits before each line above the debug level that a thread writes for a client (ClientScope).
  // Null: no limits.
  void setLineLimits(LineLimits* limits) { lineLimits_.store(limits, std::memory_order_release); }
  [[nodiscard]] bool enabled(LogLevel level) const {
    return static_cast<int>(level) >= level_.load(std::memory_order_relaxed);
  }
  [[nodiscard]] bool debugEnabled() const { return enabled(LogLevel::debug); }
  // An identifier that gives its reader a right or follows a person, for lines above the debug level: its beginning, or
  // all of it where debug lines are written, since these show it anyway.
  [[nodiscard]] std::string shownIdentifier(std::string_view identifier) const;

  void debug(const char* format, ...) __attribute__((format(printf, 2, 3)));
  void normal(const char* format, ...) __attribute__((format(printf, 2, 3)));  // the level "default"
  void error(const char* format, ...) __attribute__((format(printf, 2, 3)));

  // For the formats that show an object as "%@", which the compiler cannot check: see Description.h.
  void debugObjects(const char* format, std::initializer_list<Value> objects);

 private:
  void write(LogLevel level, const char* format, va_list arguments) __attribute__((format(printf, 3, 0)));
  // Or gives it to the order that this thread has entered (LineOrder).
  void writeOut(LogLevel level, std::string_view line);
  // `line`: all `whole` bytes of it, or more than are shown.
  void writeLine(LogLevel level, std::string line, size_t whole);
  [[nodiscard]] bool isTooMuch(const char* format) const;
  LogSink* sink_;
  std::atomic<LineLimits*> lineLimits_{nullptr};
  std::atomic<int> level_;
};

}  // namespace kyt
