#include "platform/linux/system/LogSinks.h"

#include <sys/stat.h>
#include <sys/uio.h>
#define SD_JOURNAL_SUPPRESS_LOCATION  // the place in this file is the same for every line
#include <systemd/sd-journal.h>

#include "platform/TextEscape.h"
#include "platform/linux/system/Files.h"

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

constexpr size_t kLongestOperation = 128;

iovec field(const std::string& text) {
  return {const_cast<char*>(text.data()), text.size()};
}

}  // namespace

void StderrSink::write(LogLevel level, std::string_view line) {
  std::string text;
  text.reserve(line.size() + 8);
  text += '<';
  text += priority(level);
  text += '>';
  appendEscaped(text, line);
  text += '\n';
  (void)writeAll(fd_, text);
}

bool JournalSink::isAvailable() {
  struct stat status = {};
  return ::stat("/run/systemd/journal/socket", &status) == 0 && S_ISSOCK(status.st_mode);
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
  if (::sd_journal_sendv(fields, 4) < 0) fallback_.write(level, line);
}

std::unique_ptr<LogSink> makeLogSink(LogTarget target) {
  // Without its socket libsystemd would report success and drop every line.
  if (target != LogTarget::standardError && JournalSink::isAvailable()) {
    return std::make_unique<JournalSink>();
  }
  return std::make_unique<StderrSink>();
}

}  // namespace kyt
