#include "platform/linux/service/JournalPowerLog.h"

#include <cerrno>
#include <string>
#include <utility>

#include "platform/base/Counters.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/service/JournalSocket.h"
#include "platform/queues/Log.h"

namespace kyt {
namespace {

// No field has a line break: the name is escaped, and description() writes JSON.
std::string entryOf(uint32_t agent, std::string_view event, const Dictionary& dictionary) {
  const std::string number = std::to_string(agent), name = escapedText(event);
  return "MESSAGE=Power-log event " + name + " of agent " + number +
         "\nPRIORITY=6\nSYSLOG_IDENTIFIER=kytreportingd\nKYT_AGENT=" + number + "\nKYT_EVENT=" + name +
         "\nKYT_DICTIONARY=" + description(Value(dictionary)) + "\n";
}

std::string entryAboutDropped(unsigned long long count) {
  return "MESSAGE=power log: " + std::to_string(count) +
         " events were dropped, since the journal did not take them\nPRIORITY=3\n"
         "SYSLOG_IDENTIFIER=kytreportingd\n";
}

}  // namespace

JournalPowerLog::~JournalPowerLog() = default;

bool JournalPowerLog::open() {
  if (entries_ != nullptr) return true;
  auto socket = JournalSocket::open();
  if (socket == nullptr) return false;
  JournalSocket& journal = *socket;
  entries_ = std::make_unique<LineWriter>(
      journal.descriptor(),
      LineWriterOptions{maxQueuedBytes_, [this] { counters_.add(Reason::powerLogEventDropped); },
                        entryAboutDropped, true,
                        [this, &journal](const std::string& entry, bool lastTime) {
                          return tryAgain(journal, entry, lastTime);
                        },
                        std::move(socket)});
  entries_->allowThread();
  return true;
}

bool JournalPowerLog::tryAgain(JournalSocket& socket, const std::string& entry, bool lastTime) {
  const bool isTooLarge = errno == EMSGSIZE;
  if (isTooLarge) {
    const bool taken = socket.sendInFile(entry) || (socket.connectAgain() && socket.sendInFile(entry));
    if (!taken) counters_.add(Reason::powerLogEventDropped);
    return false;
  }
  if (!lastTime && socket.connectAgain()) return true;
  counters_.add(Reason::powerLogUnavailable);
  return false;
}

void JournalPowerLog::registeredEvent(uint32_t agent, std::string_view event, const Dictionary& dictionary) {
  std::string entry = entryOf(agent, event, dictionary);
  MutexLock lock(mutex_);
  if (open())
    entries_->write(std::move(entry));
  else
    counters_.add(Reason::powerLogUnavailable);
}

}  // namespace kyt
