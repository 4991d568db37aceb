#include "platform/linux/system/LogSinks.h"

#include <sys/stat.h>
#include <sys/uio.h>

#include "platform/TextEscape.h"
#include "platform/linux/system/Files.h"
#include "platform/linux/system/SystemdLibrary.h"

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

constexpr size_t kLongestOperation = 128;

iovec field(const std::string& text) {
  return {const_cast<char*>(text.data()), text.size()};
}

}  // namespace

void StderrSink::write(LogLevel level, std::string_view line) {
  (void)writeAll(fd_, textOfLine(level, line));
}

PatientStderrSink::PatientStderrSink(Counters& counters, int fd, size_t maxQueuedBytes)
    : lines_(fd, LineWriterOptions{maxQueuedBytes, [&counters] { counters.add(Reason::logLineDropped); },
                                   [](unsigned long long count) {
                                     return textOfLine(LogLevel::error,
                                                       "log: " + std::to_string(count) +
                                                           " lines were dropped, since nobody read them");
                                   }}) {}

void PatientStderrSink::write(LogLevel level, std::string_view line) {
  lines_.write(textOfLine(level, line));
}

bool JournalSink::isAvailable() {
  struct stat status = {};
  return ::stat("/run/systemd/journal/socket", &status) == 0 && S_ISSOCK(status.st_mode);
}

std::unique_ptr<JournalSink> JournalSink::open(Counters& counters, std::string identifier) {
  const auto loaded = SystemdLibrary::load();
  if (const auto* problem = std::get_if<std::string>(&loaded)) {
    StderrSink().write(LogLevel::error, "JournalSink(open): no journal: " + *problem);
    return nullptr;
  }
  // The function that takes no place in the source: it would be the same for every line.
  Send* const send = std::get<SystemdLibrary>(loaded).journalSend;
  return std::unique_ptr<JournalSink>(new JournalSink(send, counters, std::move(identifier)));
}

void JournalSink::write(LogLevel level, std::string_view line) {
  std::string message = "MESSAGE=";
  appendEscaped(message, line);
  const std::string priorityField = std::string("PRIORITY=") + priority(level);
  const std::string identifier = "SYSLOG_IDENTIFIER=" + identifier_;
  std::string operation = "KYT_OPERATION=";
  const size_t colon = line.substr(0, kLongestOperation).find(':');
  if (colon != std::string_view::npos) appendEscaped(operation, line.substr(0, colon));
  const iovec fields[] = {field(message), field(priorityField), field(identifier), field(operation)};
  if (send_(fields, 4) < 0) fallback_.write(level, line);
}

std::unique_ptr<LogSink> makeLogSink(LogTarget target, Counters& counters) {
  // Without its socket libsystemd would report success and drop every line.
  if (target != LogTarget::standardError && JournalSink::isAvailable()) {
    if (auto journal = JournalSink::open(counters)) return journal;
  }
  return std::make_unique<PatientStderrSink>(counters);
}

}  // namespace kyt
