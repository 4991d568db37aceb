#include "platform/linux/service/LogSinks.h"

#include <cerrno>
#include <utility>

#include "platform/base/TextEscape.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/service/JournalSocket.h"

namespace kyt {
namespace {

char priority(LogLevel level) {
  switch (level) {
    case LogLevel::debug:
      return '7';
    case LogLevel::normal:
      return '6';
    case LogLevel::error:
      return '3';
  }
  return '3';
}

std::string textOfLine(LogLevel level, std::string_view line) {
  std::string text;
  text.reserve(line.size() + 8);
  text += '<';
  text += priority(level);
  text += '>';
  appendEscaped(text, line);
  text += '\n';
  return text;
}

std::string aboutDropped(unsigned long long count) {
  return "log: " + std::to_string(count) + " lines were dropped, since nobody read them";
}

constexpr size_t kLongestOperation = 128;
constexpr std::string_view kMessage = "MESSAGE=";
constexpr std::string_view kPriority = "PRIORITY=";

// A field a line, since no field has a line break once it is escaped.
std::string entryOfLine(const std::string& identifier, LogLevel level, std::string_view line) {
  std::string entry(kMessage);
  appendEscaped(entry, line);
  entry.append("\n").append(kPriority).append(1, priority(level));
  entry.append("\nSYSLOG_IDENTIFIER=").append(identifier).append("\nKYT_OPERATION=");
  const size_t colon = line.substr(0, kLongestOperation).find(':');
  if (colon != std::string_view::npos) appendEscaped(entry, line.substr(0, colon));
  entry += '\n';
  return entry;
}

}  // namespace

void StderrSink::write(LogLevel level, std::string_view line) {
  (void)writeAll(fd_, textOfLine(level, line));
}

PatientStderrSink::PatientStderrSink(Counters& counters, int fd, size_t maxQueuedBytes)
    : lines_(fd, LineWriterOptions{maxQueuedBytes, [&counters] { counters.add(Reason::logLineDropped); },
                                   [](unsigned long long count) {
                                     return textOfLine(LogLevel::error, aboutDropped(count));
                                   },
                                   false, nullptr, nullptr}) {}

void PatientStderrSink::write(LogLevel level, std::string_view line) {
  lines_.write(textOfLine(level, line));
}

bool JournalSink::isAvailable() {
  return JournalSocket::isThere();
}

std::unique_ptr<JournalSink> JournalSink::open(Counters& counters, std::string identifier,
                                               size_t maxQueuedBytes) {
  auto socket = JournalSocket::open();
  if (socket == nullptr) {
    StderrSink().write(LogLevel::error, "JournalSink(open): no journal: " + errorText(errno));
    return nullptr;
  }
  return std::unique_ptr<JournalSink>(
      new JournalSink(std::move(socket), counters, std::move(identifier), maxQueuedBytes));
}

JournalSink::JournalSink(std::shared_ptr<JournalSocket> socket, Counters& counters, std::string identifier,
                         size_t maxQueuedBytes)
    : socket_(std::move(socket)),
      identifier_(std::move(identifier)),
      fallback_(counters),
      entries_(
          socket_->descriptor(),
          LineWriterOptions{
              maxQueuedBytes, [&counters] { counters.add(Reason::logLineDropped); },
              [name = identifier_](unsigned long long count) {
                return entryOfLine(name, LogLevel::error, aboutDropped(count));
              },
              true, [this](const std::string& entry, bool lastTime) { return connectAgain(entry, lastTime); },
              socket_}) {}

bool JournalSink::connectAgain(const std::string& entry, bool lastTime) {
  if (!lastTime && socket_->connectAgain()) return true;
  const std::string_view text = std::string_view(entry).substr(kMessage.size());
  const size_t end = text.find('\n');
  const char level = text.substr(end + 1 + kPriority.size()).front();
  const LogLevel levels[] = {LogLevel::debug, LogLevel::normal, LogLevel::error};
  for (const LogLevel each : levels)
    if (priority(each) == level) fallback_.write(each, text.substr(0, end));
  return false;
}

void JournalSink::allowThreads() {
  fallback_.allowThreads();
  entries_.allowThread();
}

void JournalSink::write(LogLevel level, std::string_view line) {
  entries_.write(entryOfLine(identifier_, level, line));
}

std::unique_ptr<LogSink> makeLogSink(LogTarget target, Counters& counters, const std::string& identifier) {
  if (target != LogTarget::standardError && JournalSink::isAvailable()) {
    if (auto journal = JournalSink::open(counters, identifier)) return journal;
  }
  return std::make_unique<PatientStderrSink>(counters);
}

}  // namespace kyt
