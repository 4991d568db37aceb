#include "platform/queues/Log.h"
#include "platform/objects/Description.h"

#include <algorithm>
#include <cstdio>
#include <string>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/queues/LineLimits.h"
#include "platform/queues/LineOrder.h"

namespace kyt {

std::string Log::shownIdentifier(std::string_view identifier) const {
  return debugEnabled() ? std::string(identifier) : beginningOf(identifier);
}

void Log::debug(const char* format, ...) {
  if (!enabled(LogLevel::debug)) return;
  va_list arguments;
  va_start(arguments, format);
  write(LogLevel::debug, format, arguments);
  va_end(arguments);
}

bool Log::isTooMuch(const char* format) const {
  const std::optional<uint32_t> user = ClientScope::user();
  if (!user) return false;
  LineLimits* const limits = lineLimits_.load(std::memory_order_acquire);
  return limits != nullptr && !limits->admits(*user, format);
}

void Log::normal(const char* format, ...) {
  if (!enabled(LogLevel::normal) || isTooMuch(format)) return;
  va_list arguments;
  va_start(arguments, format);
  write(LogLevel::normal, format, arguments);
  va_end(arguments);
}

void Log::error(const char* format, ...) {
  if (!enabled(LogLevel::error) || isTooMuch(format)) return;
  va_list arguments;
  va_start(arguments, format);
  write(LogLevel::error, format, arguments);
  va_end(arguments);
}

void Log::debugObjects(const char* format, std::initializer_list<Value> objects) {
  if (!enabled(LogLevel::debug)) return;
  std::string line = formatObjects(format, objects);
  const size_t whole = line.size();
  writeLine(LogLevel::debug, std::move(line), whole);
}

void Log::write(LogLevel level, const char* format, va_list arguments) {
  char buffer[1024];
  va_list again;
  va_copy(again, arguments);
  const int length = std::vsnprintf(buffer, sizeof buffer, format, arguments);
  if (length < 0) {
    writeOut(level, format);  // a conversion failed: what it was about is better than nothing
  } else if (static_cast<size_t>(length) < sizeof buffer) {
    writeOut(level, std::string_view(buffer, static_cast<size_t>(length)));
  } else {
    // No more of it than is shown, and one byte, so that the cut does not go through a character.
    const auto whole = static_cast<size_t>(length);
    std::string line(std::min(whole, Limits::maxLogLineBytes + 1), '\0');
    std::vsnprintf(line.data(), line.size() + 1, format, again);
    writeLine(level, std::move(line), whole);
  }
  va_end(again);
}

// Sinks escape what they write, and what is escaped may be four times as long: that is what counts.
void Log::writeLine(LogLevel level, std::string line, size_t whole) {
  const size_t end = lengthThatFits(line, Limits::maxLogLineBytes);
  if (end < whole) {
    line.resize(end);
    line.append(" (cut, ").append(std::to_string(whole)).append(" bytes in all)");
  }
  writeOut(level, line);
}

void Log::writeOut(LogLevel level, std::string_view line) {
  if (!LineOrder::takes(*sink_, level, line)) sink_->write(level, line);
}

}  // namespace kyt
